// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/datagram/Deadline.h"

#include <gtest/gtest.h>
#include <poll.h>

#include <cerrno>
#include <climits>

#include "platform/datagram/LocalSocket.h"

namespace brenvik {
namespace {

using std::chrono::milliseconds;

TEST(DeadlineTest, TheTimeLeftIsWhatPollTakes) {
  EXPECT_EQ(Deadline::never().millisecondsForPoll(), -1);
  EXPECT_EQ(Deadline::past().millisecondsForPoll(), 0);
  EXPECT_EQ(Deadline::in(milliseconds(std::int64_t{INT_MAX} * 1000)).millisecondsForPoll(), INT_MAX);
  // Rounded up: a poll that ends before the deadline would only be made once more.
  const auto nearly = Deadline::Clock::now() + std::chrono::hours(1) - std::chrono::microseconds(1);
  const int left = Deadline(nearly).millisecondsForPoll();
  EXPECT_LE(left, 3'600'000);
  EXPECT_GT(left, 3'000'000);
}

TEST(DeadlineTest, NeverDoesNotPassAndComesLast) {
  EXPECT_FALSE(Deadline::never().hasPassed());
  EXPECT_TRUE(Deadline::past().hasPassed());
  EXPECT_LT(Deadline::past(), Deadline::in(milliseconds(0)));
  EXPECT_LT(Deadline::in(milliseconds(0)), Deadline::never());
  EXPECT_EQ(Deadline::never().forTimer().tv_sec, 0);
  EXPECT_EQ(Deadline::past().forTimer().tv_nsec, 1);
}

TEST(DeadlineTest, ADeadlineThatHasPassedStillLooksOnce) {
  UniqueFd ours;
  UniqueFd theirs;
  ASSERT_EQ(makeSocketPair(&ours, &theirs), 0);
  EXPECT_EQ(waitFor(ours.get(), POLLIN, Deadline::past()), ETIMEDOUT);
  EXPECT_EQ(waitFor(ours.get(), POLLOUT, Deadline::past()), 0);
  theirs.reset();
  EXPECT_EQ(waitFor(ours.get(), POLLIN, Deadline::never()), 0) << "a hang-up";
}

}  // namespace
}  // namespace brenvik
