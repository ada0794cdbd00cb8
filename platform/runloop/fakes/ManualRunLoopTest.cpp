// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/runloop/fakes/ManualRunLoop.h"

#include <gtest/gtest.h>

namespace brenvik {
namespace {

using namespace std::chrono_literals;

TEST(ManualWorkQueueTest, DelayedWorkRunsAtItsTimeAndNotBefore) {
  ManualClock clock;
  ManualWorkQueue queue(clock);
  bool ran = false;
  queue.postAfter(5s, [&] { ran = true; });

  clock.advance(4999ms);
  queue.runReady();
  EXPECT_FALSE(ran);

  clock.advance(1ms);
  queue.runReady();
  EXPECT_TRUE(ran);
}

TEST(ManualWorkQueueTest, TimerFiresRepeatedlyUntilCancelled) {
  ManualClock clock;
  ManualWorkQueue queue(clock);
  int fired = 0;
  auto timer = queue.makeTimer(0s, 2s, 0s, [&] { ++fired; });
  clock.advance(10s);
  queue.runReady();
  EXPECT_EQ(fired, 0) << "inactive until activated";
  timer->activate();
  for (int second = 0; second <= 4; ++second) {
    queue.runReady();
    clock.advance(1s);
  }
  EXPECT_EQ(fired, 3);
  timer->cancel();
  clock.advance(10s);
  queue.runReady();
  EXPECT_EQ(fired, 3);
}

TEST(ManualWorkQueueTest, TicksThatCouldNotRunYetBecomeOne) {
  ManualClock clock;
  ManualWorkQueue queue(clock);
  int fired = 0;
  const auto timer = queue.makeTimer(0s, 2s, 0s, [&] { ++fired; });
  timer->activate();
  clock.advance(9s);
  queue.runReady();
  EXPECT_EQ(fired, 1);
  clock.advance(1s);
  queue.runReady();
  EXPECT_EQ(fired, 2);
}

TEST(ManualRunLoopTest, TimerCanBeDestroyedByItsOwnHandler) {
  ManualClock clock;
  ManualRunLoop loop(clock);
  std::unique_ptr<LoopSource> timer;
  int fired = 0;
  timer = loop.addTimer(10s, 10s,
                        [&] {
                          ++fired;
                          timer.reset();
                        },
                        {});
  clock.advance(60s);
  EXPECT_EQ(fired, 1);
  EXPECT_EQ(loop.timers(), 0U);
}

}  // namespace
}  // namespace brenvik
