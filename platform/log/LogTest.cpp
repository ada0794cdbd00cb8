// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/log/Log.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <string>

#include "platform/log/fakes/RecordingLog.h"

namespace brenvik {
namespace {

TEST(LogTest, LinesKeepTheirChannelLevelAndText) {
  RecordingLog log;
  logUnified(LogLevel::info, "Loading %s as plist", "/a");
  logBsd(SyslogPriority::error, "VM_ALLOCATE %ul (mhs1)\n", 12U);
  EXPECT_EQ(log.entries(),
            (std::vector{RecordingLog::unifiedLine(LogLevel::info, "Loading /a as plist"),
                         RecordingLog::bsdLine(SyslogPriority::error, "VM_ALLOCATE 12l (mhs1)\n")}));
}

TEST(LogTest, LoggingLeavesErrnoAsItWas) {
  RecordingLog log;
  errno = ENOSPC;
  logUnified(LogLevel::error, "%s", "text");
  EXPECT_EQ(errno, ENOSPC);
}

TEST(LogTest, ALineThatIsTooLongIsCutAndNotLost) {
  RecordingLog log;
  logUnified(LogLevel::error, "%s", std::string(10000, 'x').c_str());
  ASSERT_EQ(log.entries().size(), 1U);
  EXPECT_EQ(log.entries()[0].line, std::string(4095, 'x'));
}

TEST(LogTest, AMessageIdIsMadeOfTheTextAsItStandsInTheSource) {
  // The published value of FNV-1a for "foobar".
  EXPECT_EQ(messageIdOf("foobar", "line"), (MessageId{0x343E1662793C64BF, 0x6F0D3597BA446F18}));
  EXPECT_EQ(messageIdOf("foobar\n", "line"), messageIdOf("foobar", "another line"));
  EXPECT_EQ(messageIdOf("%s", "foobar"), messageIdOf("foobar", ""));
  EXPECT_NE(messageIdOf("%s: %s", "foobar"), messageIdOf("foobar", ""));
}

TEST(LogTest, WithoutASinkNothingHappens) {
  LogSink* const before = setLogSink(nullptr);
  logUnified(LogLevel::error, "%d", 1);
  logBsd(SyslogPriority::notice, "%d", 1);
  setLogSink(before);
}

}  // namespace
}  // namespace brenvik
