// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "interface/status/Status.h"

#include <gtest/gtest.h>

#include <string>

namespace brenvik {
namespace {

using namespace std::chrono_literals;

StatusReport fullReport() {
  StatusReport report;
  report.version = "0.1.0";
  report.process = 123;
  report.executable = "/usr/libexec/brenvik/BrenvikMobileHelper";
  report.isReplaced = true;
  report.socket = "/run/brenvik/bootstrap/com.norvale.brenvik.mobile-helper";
  report.running = 123456ms;
  report.clients = 2;
  report.busyTokens = 3;
  report.busy = {{"database-check", 2}, {"heartbeat", 1}};
  report.isKeptByBaseband = true;
  report.leavesIn = 7000ms;
  report.isHeartbeatOn = true;
  report.heartbeatSent = {12, 480};
  report.heartbeatReceived = {11, 440};
  report.databases = {{"gsm", {"updated", 3000ms}}, {"umts", {"checking", 10ms}}};
  report.locationAnswer = {"answered", 3000ms};
  report.workers = {{"network", true}, {"stores", false}};
  return report;
}

std::string leastText() {
  return "brenvik-status=1\nversion=1\nprocess=1\nrunning-ms=1\nclients=0\nbusy-tokens=0\n";
}

TEST(StatusTest, WhatIsWrittenIsReadAsTheSame) {
  EXPECT_EQ(readStatus(writeStatus(fullReport())), fullReport());
  EXPECT_EQ(readStatus(writeStatus({})), StatusReport{});
}

TEST(StatusTest, ALineStandsForEachFact) {
  EXPECT_EQ(
      writeStatus(fullReport()),
      "brenvik-status=1\nversion=0.1.0\nprocess=123\nexecutable=/usr/libexec/brenvik/BrenvikMobileHelper\n"
      "replaced=yes\nsocket=/run/brenvik/bootstrap/com.norvale.brenvik.mobile-helper\nrunning-ms=123456\n"
      "clients=2\nbusy-tokens=3\nbusy=database-check 2\nbusy=heartbeat 1\nkept-by-baseband=yes\n"
      "leaves-in-ms=7000\nheartbeat=yes\nheartbeat-sent=12 480\nheartbeat-received=11 440\n"
      "database=gsm updated 3000\ndatabase=umts checking 10\nlocation-answer=answered 3000\n"
      "worker=network running\nworker=stores stopped\n");
}

TEST(StatusTest, NothingInAValueMakesALineOfItsOwn) {
  StatusReport report;
  report.executable = "/tmp/a\nclients=7\x7f";
  report.busy = {{"two words", 1}};
  report.leavesIn = -1ms;
  const auto read = readStatus(writeStatus(report));
  ASSERT_TRUE(read);
  EXPECT_EQ(read->executable, "/tmp/aclients=7");
  EXPECT_EQ(read->clients, 0U);
  EXPECT_EQ(read->busy, (std::vector<StatusReport::Busy>{{"unknown", 1}}));
  EXPECT_EQ(read->leavesIn, 0ms);
}

TEST(StatusTest, AKeyOfANewerHelperIsPassedOver) {
  EXPECT_TRUE(readStatus(leastText() + "something-else=of any kind\n"));
}

TEST(StatusTest, EveryMissingLineOfTheLeastIsNoticed) {
  ASSERT_TRUE(readStatus(leastText()));
  for (std::size_t begin = 0; begin < leastText().size();) {
    std::string text = leastText();
    const std::size_t end = text.find('\n', begin) + 1;
    text.erase(begin, end - begin);
    EXPECT_FALSE(readStatus(text)) << text;
    begin = end;
  }
}

TEST(StatusTest, EveryShorterTextIsReadOrRefusedAndNoneWithinALineIsTaken) {
  const std::string text = writeStatus(fullReport());
  for (std::size_t size = 0; size < text.size(); ++size) {
    const auto read = readStatus(text.substr(0, size));
    if (size == 0 || text[size - 1] != '\n') {
      EXPECT_FALSE(read) << size;
    }
  }
}

TEST(StatusTest, EveryFlippedBitIsSurvived) {
  const std::string text = writeStatus(fullReport());
  for (std::size_t i = 0; i < 8 * text.size(); ++i) {
    std::string flipped = text;
    flipped[i / 8] = static_cast<char>(flipped[i / 8] ^ (1 << i % 8));
    if (const auto read = readStatus(flipped)) {
      EXPECT_TRUE(readStatus(writeStatus(*read)));
    }
  }
}

TEST(StatusTest, WrongValuesAreRefused) {
  for (const char* line : {"clients=1", "heartbeat=on", "heartbeat-sent=1", "heartbeat-sent=1 2 3",
                           "leaves-in-ms=-1", "leaves-in-ms=9007199254740993", "busy=Word 1", "busy=word",
                           "database=gsm updated", "database=gsm updated x", "location-answer=answered",
                           "worker=network", "worker= running", "replaced=", "no equals sign", "=1", ""}) {
    EXPECT_FALSE(readStatus(leastText() + line + "\n")) << line;
  }
  EXPECT_FALSE(readStatus("brenvik-status=2\n" + leastText()));
  EXPECT_FALSE(readStatus(leastText() + "x=" + std::string(kLargestStatus, 'x') + "\n"));
  std::string many = leastText();
  for (int i = 0; i < 65; ++i) many += "worker=a running\n";
  EXPECT_FALSE(readStatus(many));
}

TEST(StatusTest, WhatHoldsTheHelperIsSaidInWords) {
  StatusReport report;
  EXPECT_TRUE(busyReasons(report).empty());
  report.isKeptByBaseband = true;
  EXPECT_EQ(busyReasons(report), (std::vector<std::string>{"the hosted baseband server"}));
  report.clients = 1;
  EXPECT_EQ(busyReasons(report), (std::vector<std::string>{"1 client"}));
  report = fullReport();
  EXPECT_EQ(busyReasons(report),
            (std::vector<std::string>{"2 clients", "a database check", "the heartbeat"}));
  report.isHeartbeatOn = false;
  report.busy = {{"heartbeat", 1}, {"something", 1}};
  EXPECT_EQ(busyReasons(report),
            (std::vector<std::string>{"2 clients", "a heartbeat that was switched on more than once",
                                      "something"}));
}

}  // namespace
}  // namespace brenvik
