// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <fcntl.h>
#include <sys/socket.h>

#include <cstdint>
#include <functional>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include "platform/worker/Worker.h"

namespace brenvik {

// Serves each channel with a function, on a thread of its own. The function returns when its channel hangs
// up, as it does at the latest when this object is destroyed.
class ThreadedWorker final : public Worker {
 public:
  using Serve = std::function<void(std::uint32_t work, WorkerChannel channel)>;
  explicit ThreadedWorker(Serve serve) : serve_(std::move(serve)) {}
  ThreadedWorker(const ThreadedWorker&) = delete;
  ThreadedWorker& operator=(const ThreadedWorker&) = delete;
  ~ThreadedWorker() override {
    die();
    for (std::thread& each : threads_) each.join();
  }

  WorkerResult open(std::uint32_t work, WorkerChannel* channel) noexcept override {
    channel->close();
    const std::lock_guard lock(mutex_);
    ++opened_;
    if (answer_ != WorkerResult::done) return answer_;
    WorkerChannel theirs;
    if (const auto made = WorkerChannel::makePair(channel, &theirs); made != WorkerResult::done) return made;
    channel->setGeneration(generation_);
    channel->distrust();
    sockets_.emplace_back(::fcntl(theirs.descriptor(), F_DUPFD_CLOEXEC, 0));
    threads_.emplace_back([this, work, theirs = std::move(theirs), copy = sockets_.back().get()]() mutable {
      serve_(work, std::move(theirs));
      ::shutdown(copy, SHUT_RDWR);
    });
    return WorkerResult::done;
  }

  void start() noexcept override {
    const std::lock_guard lock(mutex_);
    ++started_;
  }

  void giveUp(WorkerChannel* channel) noexcept override {
    const bool isOurs = channel->isOpen() && channel->generation() == generation();
    channel->close();
    if (!isOurs) return;
    die();
    const std::lock_guard lock(mutex_);
    ++givenUp_;
  }

  // All channels hang up; the next one belongs to a new worker.
  void die() noexcept {
    const std::lock_guard lock(mutex_);
    ++generation_;
    for (const UniqueFd& socket : sockets_) (void)::shutdown(socket.get(), SHUT_RDWR);
  }

  // Sets the result of later open() calls; unless it is `done`, they open nothing.
  void answerWith(WorkerResult answer) noexcept {
    const std::lock_guard lock(mutex_);
    answer_ = answer;
  }
  int opened() const noexcept {
    const std::lock_guard lock(mutex_);
    return opened_;
  }
  // How often start() was called.
  int started() const noexcept {
    const std::lock_guard lock(mutex_);
    return started_;
  }
  int givenUp() const noexcept {
    const std::lock_guard lock(mutex_);
    return givenUp_;
  }

 private:
  std::uint64_t generation() const noexcept {
    const std::lock_guard lock(mutex_);
    return generation_;
  }

  const Serve serve_;
  mutable std::mutex mutex_;  // guards everything below
  WorkerResult answer_ = WorkerResult::done;
  std::uint64_t generation_ = 1;
  int opened_ = 0;
  int started_ = 0;
  int givenUp_ = 0;
  std::vector<UniqueFd> sockets_;  // copies of the workers' ends
  std::vector<std::thread> threads_;
};

}  // namespace brenvik
