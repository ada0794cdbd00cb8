// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/BegunCalls.h"

#include <gtest/gtest.h>

namespace brenvik::client {
namespace {

TEST(BegunCallsListTest, AFinishedCallKeepsItsResultAndNoMessage) {
  BegunCalls calls;
  const auto place = calls.add(7);
  place->message.resize(100);
  place->regions[0].resize(100);
  calls.markSent(place);
  calls.finish(*place, 5, 6);
  ASSERT_EQ(calls.finished().size(), 1U);
  const BegunCall& finished = calls.finished().front();
  EXPECT_EQ(finished.result.call, 7U);
  EXPECT_EQ(finished.result.code, 5);
  EXPECT_EQ(finished.result.system_error, 6);
  EXPECT_EQ(finished.message.capacity(), 0U);
  EXPECT_EQ(finished.regions[0].capacity(), 0U);
}

}  // namespace
}  // namespace brenvik::client
