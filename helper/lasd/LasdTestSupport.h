// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "helper/lasd/HttpFetcher.h"
#include "platform/gzip/fakes/GzipOf.h"
#include "platform/gzip/linux/ZlibGunzip.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/runloop/fakes/ManualRunLoop.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/web/fakes/ScriptedWebClient.h"

namespace brenvik {

inline std::string contentOf(const std::filesystem::path& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}

// Real queues, except the updater's, which runs when the test says so. Fetches block that queue; their
// answers arrive on real threads.
class LasdTestQueues final : public WorkQueues {
 public:
  WorkQueue& main() noexcept override { return system_.main(); }
  WorkQueue& global() override { return system_.global(); }
  std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService qualityOfService) override {
    if (refuseQueues || (refuseQueueAfter > 0 && --refuseQueueAfter == 0)) throw OutOfQueues();
    made.emplace_back(label, qualityOfService);
    if (label != "LASDUpdater") return system_.makeSerial(std::move(label), qualityOfService);
    updater = std::make_shared<ManualWorkQueue>(clock_, std::move(label), qualityOfService);
    return updater;
  }
  std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t pid, std::uint32_t startTime,
                                                           WorkQueue::Task onExit,
                                                           WorkQueue::Task onCancel) override {
    return system_.makeProcessExitSource(pid, startTime, std::move(onExit), std::move(onCancel));
  }

  std::vector<std::pair<std::string, QualityOfService>> made;
  std::shared_ptr<ManualWorkQueue> updater;
  bool refuseQueues = false;
  int refuseQueueAfter = 0;  // 1: the next queue is refused, 2: the one after it ...; 0: none

 private:
  ManualClock clock_;
  std::unique_ptr<SystemRunLoop> loop_ = SystemRunLoop::make();
  SystemQueues system_{*loop_};
};

class LasdTest : public testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = testing::TempDir() + "lasdXXXXXX";
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    folder = pattern;
  }
  void TearDown() override {
    if (!folder.empty()) std::filesystem::remove_all(folder);
  }
  // A disk with room for everything, whatever the machine has.
  static DiskSpace roomyDisk(int) { return {std::uint64_t{1} << 40, std::uint64_t{1} << 40}; }
  HttpFetcher::Parts fetcherParts(std::function<DiskSpace(int)> diskSpace = roomyDisk) {
    return {queues, web, gunzip, std::move(diskSpace)};
  }
  void serveGzip(const std::string& url, const std::string& content) {
    web.answer(url, 200, gzipOf(content), {{"Content-Type", "application/gzip"}});
  }
  static RecordingLog::Entry info(std::string line) {
    return RecordingLog::unifiedLine(LogLevel::info, std::move(line));
  }
  static RecordingLog::Entry error(std::string line) {
    return RecordingLog::unifiedLine(LogLevel::error, std::move(line));
  }
  using Lines = std::vector<RecordingLog::Entry>;

  LasdTestQueues queues;
  ScriptedWebClient web;
  ZlibGunzip gunzip;
  RecordingLog log;
  std::filesystem::path folder;
};

}  // namespace brenvik
