// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/core/StatusLine.h"

#include <gtest/gtest.h>

#include <memory>
#include <new>
#include <string>
#include <vector>

#include "platform/base/fakes/FailingAllocations.h"
#include "platform/runloop/fakes/ManualRunLoop.h"
#include "platform/servicemanager/fakes/RecordingServiceManager.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

class StatusLineTest : public testing::Test {
 protected:
  void pass(std::chrono::milliseconds time) {
    queues.main().runReady();
    clock.advance(time);
    queues.main().runReady();
  }

  ManualClock clock;
  ManualWorkQueues queues{clock};
  RecordingServiceManager manager;
  std::string text = "first";
  std::unique_ptr<StatusLine> line = std::make_unique<StatusLine>(queues, manager, [this] { return text; });
};

TEST_F(StatusLineTest, AChangeIsShownASecondLaterAsThingsAreThen) {
  line->changed();
  pass(999ms);
  EXPECT_TRUE(manager.lines.empty());
  text = "second";
  line->changed();
  pass(1ms);
  EXPECT_EQ(manager.lines, std::vector<std::string>{"second"});
}

TEST_F(StatusLineTest, ManyChangesCostOneLineASecond) {
  for (int i = 0; i < 50; ++i) {
    text = std::to_string(i);
    line->changed();
    pass(100ms);
  }
  EXPECT_GE(manager.lines.size(), 4U);
  EXPECT_LE(manager.lines.size(), 5U);
}

TEST_F(StatusLineTest, ALineThatStaysIsNotShownAgainAndNothingWakesUpForIt) {
  line->changed();
  pass(1s);
  line->changed();
  pass(1s);
  EXPECT_EQ(manager.lines.size(), 1U);
  EXPECT_EQ(clock.scheduled(), 0U);
}

TEST_F(StatusLineTest, NothingIsDoneBeforeTheMainLoopHasItsTurn) {
  line->changed();
  EXPECT_EQ(clock.scheduled(), 0U);
  EXPECT_EQ(queues.main().pending(), 1U);
}

TEST_F(StatusLineTest, WithoutAServiceManagerNothingIsDone) {
  manager.isListening = false;
  line->changed();
  EXPECT_EQ(queues.main().pending(), 0U);
}

TEST_F(StatusLineTest, AChangeThatIsLostForLackOfMemoryIsShownWithTheNextOne) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "nothing fails under this sanitizer";
  line->changed();
  {
    const FailingAllocations failing(0);
    EXPECT_THROW(queues.main().runReady(), std::bad_alloc);
  }
  pass(1s);
  EXPECT_TRUE(manager.lines.empty());
  line->changed();
  pass(1s);
  EXPECT_EQ(manager.lines, std::vector<std::string>{"first"});
}

TEST_F(StatusLineTest, WhatIsUnderWayWhenItEndsIsForgotten) {
  line->changed();
  queues.main().runReady();
  line.reset();
  clock.advance(1s);
  queues.main().runReady();
  EXPECT_TRUE(manager.lines.empty());
}

}  // namespace
}  // namespace brenvik
