// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <memory>
#include <string>

#include "platform/runloop/RunLoop.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/runloop/linux/EventLoop.h"

namespace brenvik {

// The run loop of the thread that makes it, built on epoll(7).
class SystemRunLoop final : public RunLoop {
 public:
  // Returns null if the system is out of descriptors or memory.
  static std::unique_ptr<SystemRunLoop> make();

  RunResult run(std::chrono::duration<double> timeOut, ReturnAfterSource returnAfterSource) override;
  void stop() noexcept override;
  std::unique_ptr<DescriptorSource> addDescriptor(int fd, Interest interest,
                                                  DescriptorHandler handler) override;
  std::unique_ptr<LoopSource> addTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                       std::function<void()> handler, std::function<void()> failed) override;

  const std::shared_ptr<EventLoop>& eventLoop() const noexcept { return loop_; }

 private:
  explicit SystemRunLoop(std::shared_ptr<EventLoop> loop) noexcept : loop_(std::move(loop)) {}
  const std::shared_ptr<EventLoop> loop_;
  std::atomic<bool> stopped_{false};
};

// Queues on threads of their own, and the main queue on the main run loop. A process-exit source is a pidfd
// (pidfd_open(2)) that the main run loop watches; the global queue's thread starts only when a process has
// exited. If the hard limit allows it, a queue may use kReservedDescriptors beyond the process's soft limit
// (RLIMIT_NOFILE), so that clients who use up all other descriptors cannot keep the process's own work from
// starting.
class SystemQueues final : public WorkQueues {
 public:
  // The descriptors that a process should leave between its soft limit and the hard one.
  static constexpr unsigned kReservedDescriptors = 36;

  // The run loop must outlive this object.
  explicit SystemQueues(SystemRunLoop& mainLoop);
  ~SystemQueues() override;

  WorkQueue& main() noexcept override;
  WorkQueue& global() override;
  std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService qualityOfService) override;
  std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t pid, std::uint32_t startTime,
                                                           WorkQueue::Task onExit,
                                                           WorkQueue::Task onCancel) override;

 private:
  class Maker;
  const std::shared_ptr<EventLoop> mainLoop_;
  const std::unique_ptr<WorkQueue> main_;
  const std::shared_ptr<Maker> maker_;  // late exit handlers hold it weakly
};

}  // namespace brenvik
