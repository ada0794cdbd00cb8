// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/ProcessFacts.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <string>

namespace brenvik {
namespace {

std::string statText(const std::string& name, const std::string& startTime) {
  return "7 (" + name + ") S 1 7 7 0 -1 4194304 100 0 0 0 0 0 0 0 20 0 1 0 " + startTime + " 1000 200\n";
}

TEST(ProcessStatTest, StateAndStartTimeAreFoundInAUsualLine) {
  const auto facts = parseProcessStat(statText("cat", "12345"));
  ASSERT_TRUE(facts);
  EXPECT_EQ(facts->state, 'S');
  EXPECT_EQ(facts->session, 7);
  EXPECT_EQ(facts->startTime, 12345U);
}

TEST(ProcessStatTest, ANameThatImitatesFieldsChangesNothing) {
  const auto facts = parseProcessStat(statText("a) Z 1 1 1 0 -1 (", "12345"));
  ASSERT_TRUE(facts);
  EXPECT_EQ(facts->state, 'S');
  EXPECT_EQ(facts->startTime, 12345U);
}

TEST(ProcessStatTest, OfALongStartTimeTheLow32BitsCount) {
  const auto facts = parseProcessStat(statText("cat", "4294967298"));
  ASSERT_TRUE(facts);
  EXPECT_EQ(facts->startTime, 2U);
}

TEST(ProcessStatTest, ALineCutShortAnywhereBeforeTheStartTimeIsRefused) {
  const std::string line = statText("cat", "12345");
  const std::size_t startTime = line.find("12345");
  for (std::size_t size = 0; size < startTime; ++size) {
    EXPECT_FALSE(parseProcessStat(line.substr(0, size))) << size;
  }
  EXPECT_FALSE(parseProcessStat(statText("cat", "x")));
}

TEST(ProcessFactsTest, TellsOfThisProcess) {
  const auto facts = processFacts(::getpid());
  ASSERT_TRUE(facts);
  EXPECT_EQ(facts->state, 'R');
  EXPECT_EQ(facts->session, ::getsid(0));
  EXPECT_EQ(processStartTime(::getpid()), facts->startTime);
}

TEST(ProcessFactsTest, TellsNothingOfNobody) {
  EXPECT_FALSE(processFacts(0x7FFFFFFF));
  EXPECT_FALSE(processStartTime(-1));
}

}  // namespace
}  // namespace brenvik
