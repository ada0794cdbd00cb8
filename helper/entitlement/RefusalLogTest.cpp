// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/entitlement/RefusalLog.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>

#include "platform/log/Log.h"
#include "platform/log/fakes/RecordingLog.h"

namespace brenvik {
namespace {

using std::chrono::seconds;
using testing::ElementsAre;
using testing::IsEmpty;

class RefusalLogTest : public testing::Test {
 protected:
  void refuse(const LogCaller& who) {
    refusals.refused(who, "com.example.allow", [this] {
      ++explanations;
      return why;
    });
  }
  static RecordingLog::Entry line(std::string text) {
    return RecordingLog::unifiedLine(LogLevel::standard, std::move(text));
  }
  static RecordingLog::Entry refusalOf(pid_t pid) {
    return line("refused process " + std::to_string(pid) +
                ": account 501, executable /usr/bin/program, unit program.service: it does not hold "
                "com.example.allow: no file names it");
  }

  const LogCaller caller{7, 501, "/usr/bin/program", "program.service"};
  std::chrono::nanoseconds now{seconds(5)};
  RefusalLog refusals{[this] { return now; }};
  RecordingLog log;
  std::string why = "no file names it";
  int explanations = 0;
};

TEST_F(RefusalLogTest, TheFirstRefusalOfACallerIsToldAtOnceWithEverythingThatIsKnown) {
  refuse(caller);
  EXPECT_THAT(log.entries(), ElementsAre(refusalOf(7)));
}

TEST_F(RefusalLogTest, WhatIsNotKnownIsSaidToBeSo) {
  why.clear();
  refuse({7, 501, "", ""});
  EXPECT_THAT(log.entries(),
              ElementsAre(line("refused process 7: account 501, executable not known, unit none: it "
                               "does not hold com.example.allow: not known")));
}

TEST_F(RefusalLogTest, FurtherRefusalsOfTheSameProgramAreCountedAndToldAMinuteLater) {
  refuse(caller);
  LogCaller another = caller;
  another.pid = 8;  // a caller that is started again and again is one caller
  for (int i = 0; i < 3; ++i) refuse(another);
  now += seconds(59);
  refuse(another);
  EXPECT_EQ(log.entries().size(), 1U);
  EXPECT_EQ(explanations, 1) << "an explanation costs a search";
  log.clear();
  now += seconds(1);
  refuse(another);
  EXPECT_THAT(log.entries(),
              ElementsAre(line("refused 4 more check-ins of account 501, executable /usr/bin/program"),
                          refusalOf(8)));
  log.clear();
  now += seconds(60);
  refuse(another);
  EXPECT_THAT(log.entries(), ElementsAre(refusalOf(8))) << "none was left untold";
}

TEST_F(RefusalLogTest, OneRefusalThatWasNotToldIsToldAMinuteLater) {
  refuse(caller);
  refuse(caller);
  log.clear();
  now += seconds(60);
  refuse(caller);
  EXPECT_THAT(log.entries(),
              ElementsAre(line("refused 1 more check-ins of account 501, executable /usr/bin/program"),
                          refusalOf(7)));
}

TEST_F(RefusalLogTest, AnotherAccountOrExecutableIsAnotherCaller) {
  refuse(caller);
  refuse({7, 502, caller.executable, ""});
  refuse({7, 501, "/usr/bin/other", ""});
  EXPECT_EQ(log.entries().size(), 3U);
}

TEST_F(RefusalLogTest, AtTheEndTheNumbersThatWereNotToldAre) {
  refuse(caller);
  refuse(caller);
  log.clear();
  refusals.flush();
  refusals.flush();
  EXPECT_THAT(log.entries(),
              ElementsAre(line("refused 1 more check-ins of account 501, executable /usr/bin/program")));
}

TEST_F(RefusalLogTest, AtTheEndOnlyNumbersThatWereNotToldAreAndEverybodyIsForgotten) {
  constexpr std::size_t kRemembered = 64;
  const auto refuseAsManyAsAreRememberedAndOneMore = [&] {
    for (std::size_t i = 0; i <= kRemembered; ++i) {
      refuse({7, static_cast<uid_t>(i), "/x", ""});
    }
    EXPECT_EQ(log.entries().size(), kRemembered + 1) << "each is told, the further one, too";
    log.clear();
  };
  refuseAsManyAsAreRememberedAndOneMore();
  refusals.flush();
  EXPECT_THAT(log.entries(), IsEmpty());
  refuseAsManyAsAreRememberedAndOneMore();
  refuse({7, 9999, "/x", ""});
  refusals.flush();
  EXPECT_THAT(log.entries(), ElementsAre(line("refused 1 more check-ins of further callers")));
}

TEST_F(RefusalLogTest, ManyCallersAreRememberedOnlyUpToALimitAndTheOthersCountAsOne) {
  const auto stranger = [](std::size_t i) { return LogCaller{7, static_cast<uid_t>(i), "/x", ""}; };
  constexpr std::size_t kMany = RefusalLog::kMaxCallers;
  for (std::size_t i = 0; i < 10 * kMany; ++i) refuse(stranger(i));
  EXPECT_EQ(log.entries().size(), kMany + 1) << "one line for all that are too many";
  log.clear();
  now += seconds(59);
  refuse(stranger(10 * kMany));
  EXPECT_THAT(log.entries(), IsEmpty());

  // A minute later those of before may be forgotten, and new ones are callers of their own.
  now += seconds(1);
  refuse(stranger(0));
  log.clear();
  refuse(stranger(10 * kMany));
  EXPECT_EQ(log.entries().size(), 1U);
  log.clear();
  refusals.flush();
  EXPECT_THAT(log.entries(), ElementsAre(line("refused " + std::to_string(9 * kMany) +
                                              " more check-ins of further callers")));
}

TEST_F(RefusalLogTest, NumbersOfThoseThatAreForgottenAndOfAllOthersAreToldInTime) {
  const auto stranger = [](std::size_t i) { return LogCaller{7, static_cast<uid_t>(i), "/x", ""}; };
  for (std::size_t i = 0; i < RefusalLog::kMaxCallers; ++i) refuse(stranger(i));
  refuse(stranger(0));
  for (std::size_t i = 0; i < 4; ++i) refuse(stranger(2000 + i));
  now += seconds(60);
  for (std::size_t i = 1; i < RefusalLog::kMaxCallers; ++i) refuse(stranger(i));
  log.clear();
  refuse(stranger(1000));  // takes the place of the only one of long ago
  EXPECT_EQ(log.entries().front(), line("refused 1 more check-ins of account 0, executable /x"));
  log.clear();
  refuse(stranger(3000));
  ASSERT_EQ(log.entries().size(), 2U);
  EXPECT_EQ(log.entries().front(), line("refused 3 more check-ins of further callers"));
}

TEST_F(RefusalLogTest, OneFurtherCallerIsToldInTimeAndNoneIsNot) {
  const auto stranger = [](std::size_t i) { return LogCaller{7, static_cast<uid_t>(i), "/x", ""}; };
  const auto refuseAllThatAreRemembered = [&] {
    for (std::size_t i = 0; i < RefusalLog::kMaxCallers; ++i) refuse(stranger(i));
    log.clear();
  };
  refuseAllThatAreRemembered();
  refuse(stranger(2000));
  refuse(stranger(2001));
  now += seconds(60);
  refuseAllThatAreRemembered();
  refuse(stranger(2002));
  ASSERT_EQ(log.entries().size(), 2U);
  EXPECT_EQ(log.entries().front(), line("refused 1 more check-ins of further callers"));
  now += seconds(60);
  refuseAllThatAreRemembered();
  refuse(stranger(2003));
  EXPECT_EQ(log.entries().size(), 1U) << "the refusal itself";
}

TEST_F(RefusalLogTest, TheFirst255BytesOfAPathTellOneExecutableFromAnother) {
  const std::string path = "/" + std::string(253, 'x');
  refuse({7, 501, path + "a", ""});
  refuse({7, 501, path + "b", ""});
  EXPECT_EQ(log.entries().size(), 2U);
  refuse({7, 501, path + "aa", ""});
  refuse({7, 501, path + "ab", ""});
  refuse({7, 501, path + "b" + std::string(1000, 'x'), ""});
  EXPECT_EQ(log.entries().size(), 2U) << "a caller cannot fill the log with paths that are told as the same";
  log.clear();
  refusals.flush();
  EXPECT_THAT(log.entries(),
              ElementsAre(line("refused 2 more check-ins of account 501, executable " + path + "a"),
                          line("refused 1 more check-ins of account 501, executable " + path + "b")));
}

TEST_F(RefusalLogTest, APathAsLongAsTheSystemAllowsLeavesRoomForTheReason) {
  refuse({7, 501, "/" + std::string(4094, 'x'), ""});
  ASSERT_EQ(log.entries().size(), 1U);
  EXPECT_THAT(log.entries()[0].line, testing::EndsWith("no file names it"));
}

}  // namespace
}  // namespace brenvik
