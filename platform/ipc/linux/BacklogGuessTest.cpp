// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/BacklogGuess.h"

#include <gtest/gtest.h>

#include <functional>

namespace brenvik {
namespace {

using namespace std::chrono_literals;

class BacklogGuessTest : public testing::Test {
 protected:
  // One turn, after the loop has waited for so long.
  void turnAfter(std::chrono::nanoseconds wait) {
    time_ += wait;
    guess.turnBegins(now_);
    guess.turnEnds(now_);
  }
  void turnsAfter(std::chrono::nanoseconds wait, unsigned count) {
    for (unsigned i = 0; i < count; ++i) turnAfter(wait);
  }

  int clockReads = 0;
  BacklogGuess guess;

 private:
  BacklogGuess::Time time_{1h};
  const std::function<BacklogGuess::Time()> now_ = [this] {
    ++clockReads;
    return time_;
  };
};

TEST_F(BacklogGuessTest, AtFirstNothingIsExpected) { EXPECT_FALSE(guess.isLikely()); }

TEST_F(BacklogGuessTest, TurnsThatFollowEachOtherAtOnceTellOfABacklog) {
  turnsAfter(300ns, BacklogGuess::kTimedTurns);
  EXPECT_FALSE(guess.isLikely()) << "the turn that is timed has just ended";
  turnAfter(300ns);
  EXPECT_TRUE(guess.isLikely());
}

TEST_F(BacklogGuessTest, AtOnceIsLessThanAMicrosecond) {
  turnsAfter(1000ns, 100);
  EXPECT_FALSE(guess.isLikely());
  turnsAfter(999ns, BacklogGuess::kTimedTurns + 1);
  EXPECT_TRUE(guess.isLikely());
}

TEST_F(BacklogGuessTest, AClientThatWaitsForEachAnswerNeverCostsALook) {
  for (int i = 0; i < 1000; ++i) {
    turnAfter(BacklogGuess::kAtOnce);
    ASSERT_FALSE(guess.isLikely()) << i;
  }
}

TEST_F(BacklogGuessTest, ALookInVainEndsTheGuessUntilTurnsFollowEachOtherAgain) {
  turnsAfter(300ns, BacklogGuess::kTimedTurns + 1);
  guess.foundNothing();
  EXPECT_FALSE(guess.isLikely());
  turnsAfter(10us, 100);
  EXPECT_FALSE(guess.isLikely());
  turnsAfter(300ns, BacklogGuess::kTimedTurns + 1);
  EXPECT_TRUE(guess.isLikely());
}

TEST_F(BacklogGuessTest, TheClockIsReadTwiceInEightTurns) {
  turnsAfter(10us, 800);
  EXPECT_LE(clockReads, 200);
  EXPECT_GE(clockReads, 199);
}

TEST_F(BacklogGuessTest, WhileABacklogIsThereTheClockIsNotRead) {
  turnsAfter(300ns, BacklogGuess::kTimedTurns + 1);
  clockReads = 0;
  turnsAfter(10us, 100);
  EXPECT_TRUE(guess.isLikely()) << "only a look in vain ends it";
  EXPECT_EQ(clockReads, 0);
}

}  // namespace
}  // namespace brenvik
