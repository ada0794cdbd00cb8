// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/radio/RadioLogging.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <limits>

#include "platform/log/fakes/RecordingLog.h"
#include "platform/radio/fakes/FakeRadioManager.h"

namespace brenvik {
namespace {

using testing::ElementsAre;

class RadioLoggingTest : public testing::Test {
 protected:
  FakeRadioManager radio;
  RecordingLog log;
  RadioLogging logging{radio};
};

TEST_F(RadioLoggingTest, EnableTwoSwitchesLoggingOnAndIsWrittenAsTwo) {
  EXPECT_EQ(logging.enableRadioManagerLogs(7, 2), 0);
  EXPECT_THAT(radio.switched, ElementsAre(true));
  EXPECT_THAT(log.entries(), ElementsAre(RecordingLog::bsdLine(SyslogPriority::error,
                                                               "Enabling wireless radio manager logs: 2")));
}

TEST_F(RadioLoggingTest, ZeroSwitchesLoggingOffAndIsWrittenTheSameWay) {
  EXPECT_EQ(logging.enableRadioManagerLogs(7, 0), 0);
  EXPECT_THAT(radio.switched, ElementsAre(false));
  EXPECT_THAT(log.entries(), ElementsAre(RecordingLog::bsdLine(SyslogPriority::error,
                                                               "Enabling wireless radio manager logs: 0")));
}

TEST_F(RadioLoggingTest, ANegativeValueSwitchesOnAndIsWrittenAsReceived) {
  EXPECT_EQ(logging.enableRadioManagerLogs(7, std::numeric_limits<std::int32_t>::min()), 0);
  EXPECT_THAT(radio.switched, ElementsAre(true));
  EXPECT_THAT(log.entries(),
              ElementsAre(RecordingLog::bsdLine(SyslogPriority::error,
                                                "Enabling wireless radio manager logs: -2147483648")));
}

TEST_F(RadioLoggingTest, TheRadioManagerIsToldBeforeTheLineIsWritten) {
  std::size_t linesWhenTold = 99;
  radio.whenSwitched = [&] { linesWhenTold = log.entries().size(); };
  logging.enableRadioManagerLogs(7, 1);
  EXPECT_EQ(linesWhenTold, 0U);
  EXPECT_EQ(log.entries().size(), 1U);
}

}  // namespace
}  // namespace brenvik
