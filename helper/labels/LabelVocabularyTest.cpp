// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/labels/LabelVocabulary.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/labeler/SubscriptionLabeler.h"

namespace {
// Allocations of this thread that may still succeed; negative: all.
thread_local long allocationsLeft = -1;
}  // namespace

// The linker sends here what the libraries of this program take from malloc.
extern "C" void* __real_malloc(std::size_t size);
extern "C" void* __wrap_malloc(std::size_t size);
extern "C" void* __wrap_malloc(std::size_t size) {
  if (allocationsLeft == 0) return nullptr;
  if (allocationsLeft > 0) --allocationsLeft;
  return __real_malloc(size);
}

namespace brenvik {
namespace {

TEST(LabelVocabularyTest, EachOfTheSixKeysYieldsItsIdentifier) {
  EXPECT_EQ(labelIdentifierForKey("USER_LABEL_PRIMARY").asString(), label_identifier::primary);
  EXPECT_EQ(labelIdentifierForKey("USER_LABEL_SECONDARY").asString(), label_identifier::secondary);
  EXPECT_EQ(labelIdentifierForKey("USER_LABEL_PERSONAL").asString(), label_identifier::personal);
  EXPECT_EQ(labelIdentifierForKey("USER_LABEL_BUSINESS").asString(), label_identifier::business);
  EXPECT_EQ(labelIdentifierForKey("USER_LABEL_TRAVEL").asString(), label_identifier::travel);
  EXPECT_EQ(labelIdentifierForKey("USER_LABEL_CELL_DATA").asString(), label_identifier::data);
}

TEST(LabelVocabularyTest, ThePrimaryKeyInLowerCaseYieldsNothing) {
  EXPECT_FALSE(labelIdentifierForKey("user_label_primary").hasValue());
  EXPECT_FALSE(labelIdentifierForKey("USER_LABEL_Primary").hasValue());
}

TEST(LabelVocabularyTest, OnlyTheCellDataKeyMapsToTheDataIdentifierAndAShorterOneEndingInDataMapsToNothing) {
  EXPECT_FALSE(labelIdentifierForKey("USER_LABEL_DATA").hasValue());
  EXPECT_FALSE(labelIdentifierForKey("DATA").hasValue());
  EXPECT_FALSE(labelIdentifierForKey("CELL_DATA").hasValue());
  EXPECT_TRUE(labelIdentifierForKey("USER_LABEL_CELL_DATA").hasValue());
}

TEST(LabelVocabularyTest, AnEmptyTextYieldsNothing) {
  EXPECT_FALSE(labelIdentifierForKey("").hasValue());
  EXPECT_FALSE(labelIdentifierForKey({}).hasValue());
}

TEST(LabelVocabularyTest, TheFullTextsAreComparedWhateverFollowsOrIsLeftOut) {
  EXPECT_FALSE(labelIdentifierForKey("USER_LABEL_TRAVE").hasValue());
  EXPECT_FALSE(labelIdentifierForKey("USER_LABEL_TRAVELS").hasValue());
  EXPECT_FALSE(labelIdentifierForKey(std::string_view("USER_LABEL_TRAVEL\0", 18)).hasValue());
  EXPECT_FALSE(labelIdentifierForKey(" USER_LABEL_TRAVEL").hasValue());
}

TEST(LabelVocabularyTest, IdentifiersAreNotKeys) {
  EXPECT_FALSE(labelIdentifierForKey(label_identifier::primary).hasValue());
  EXPECT_FALSE(labelIdentifierForKey(label_identifier::data).hasValue());
}

TEST(LabelVocabularyTest, TheSixIdentifiersAreDistinct) {
  const std::set<std::string_view> identifiers{label_identifier::primary,  label_identifier::secondary,
                                               label_identifier::personal, label_identifier::business,
                                               label_identifier::travel,   label_identifier::data};
  EXPECT_EQ(identifiers.size(), 6U);
}

TEST(LabelVocabularyTest, AnIdentifierOutlivesEveryOtherReference) {
  PropertyList kept;
  {
    const PropertyList first = labelIdentifierForKey("USER_LABEL_TRAVEL");
    kept = labelIdentifierForKey("USER_LABEL_TRAVEL");
  }
  EXPECT_EQ(kept.asString(), label_identifier::travel);
}

TEST(LabelVocabularyTest, ThreadsThatAskAtTheSameTimeGetTheSameAnswer) {
  std::vector<PropertyList> answers(8);
  std::vector<std::thread> threads;
  threads.reserve(answers.size());
  for (PropertyList& answer : answers) {
    threads.emplace_back([&answer] { answer = labelIdentifierForKey("USER_LABEL_BUSINESS"); });
  }
  for (std::thread& thread : threads) thread.join();
  for (const PropertyList& answer : answers) EXPECT_EQ(answer.asString(), label_identifier::business);
}

// In a process of its own, where the table does not stand yet. Exits with the number of calls that failed
// before one succeeded, or 99 on a wrong answer.
[[noreturn]] void buildWithFailingMemory() {
  for (int failed = 0;; ++failed) {
    allocationsLeft = failed;
    try {
      const PropertyList answer = labelIdentifierForKey("USER_LABEL_CELL_DATA");
      allocationsLeft = -1;
      ::_exit(answer.asString() == label_identifier::data ? failed : 99);
    } catch (const std::bad_alloc&) {
      allocationsLeft = -1;
    }
  }
}

TEST(LabelVocabularyDeathTest, ATableThatCouldNotBeBuiltIsTriedAgainByTheNextCall) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");  // the child starts anew, without this process's table
  // Twelve texts, so some early tries fail part-way; the first that has enough memory succeeds.
  EXPECT_EXIT(
      buildWithFailingMemory(),
      [](int status) { return WIFEXITED(status) && WEXITSTATUS(status) >= 12 && WEXITSTATUS(status) < 99; },
      "");
}

}  // namespace
}  // namespace brenvik
