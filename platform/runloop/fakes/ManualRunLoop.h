// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/runloop/RunLoop.h"
#include "platform/runloop/WorkQueue.h"

namespace brenvik {

// Time that moves when a test says so. Everything manual shares one clock. One thread only.
class ManualClock {
 public:
  using Time = std::chrono::nanoseconds;

  Time now() const noexcept { return now_; }

  // Moves time on, running what comes due at its own moment, in order of time, then of scheduling.
  void advance(Time by) {
    const Time end = now_ + by;
    for (auto due = next(); due && *due <= end; due = next()) (void)runNext();
    now_ = end;
  }

  // Schedules `action`; the id cancels it.
  std::pair<Time, std::uint64_t> schedule(Time delay, std::function<void()> action) {
    const auto id = std::make_pair(now_ + std::max(delay, Time::zero()), ++last_);
    due_.emplace(id, std::move(action));
    return id;
  }
  void cancel(const std::pair<Time, std::uint64_t>& id) { due_.erase(id); }
  std::size_t scheduled() const noexcept { return due_.size(); }
  // When the next action comes due; none if nothing is scheduled.
  std::optional<Time> next() const {
    return due_.empty() ? std::nullopt : std::optional(due_.begin()->first.first);
  }
  // Moves time on to the next action and runs that one alone; false if nothing is scheduled.
  bool runNext() {
    if (due_.empty()) return false;
    now_ = std::max(now_, due_.begin()->first.first);
    auto action = std::move(due_.begin()->second);
    due_.erase(due_.begin());
    action();
    return true;
  }

 private:
  Time now_{0};
  std::uint64_t last_ = 0;
  std::map<std::pair<Time, std::uint64_t>, std::function<void()>> due_;
};

// A serial queue that runs its tasks when told to: runReady() runs what is posted, the clock what is delayed
// (a delayed task that comes due is posted, so runReady() must follow). One thread only.
class ManualWorkQueue final : public WorkQueue {
 public:
  explicit ManualWorkQueue(ManualClock& clock, std::string label = "manual",
                           QualityOfService qualityOfService = QualityOfService::standard)
      : clock_(clock), label_(std::move(label)), qualityOfService_(qualityOfService) {}

  const std::string& label() const noexcept override { return label_; }
  QualityOfService qualityOfService() const noexcept { return qualityOfService_; }

  // How timers behave from now on, and the leeway that each was given.
  enum class Timers { work, cannotBeMade, cannotBeArmed };
  Timers timers = Timers::work;
  std::vector<std::chrono::nanoseconds> leeways;

  void post(Task task) override { ready_.push_back(std::move(task)); }
  void postAfter(std::chrono::nanoseconds delay, Task task) override {
    clock_.schedule(delay, [alive = std::weak_ptr<void>(alive_), this, task = std::move(task)]() mutable {
      if (!alive.expired()) post(std::move(task));
    });
  }
  std::unique_ptr<Timer> makeTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                   std::chrono::nanoseconds leeway, Task handler) override;
  bool isCurrent() const noexcept override { return running_; }
  std::unique_ptr<DescriptorSource> watchDescriptor(int, Interest, RunLoop::DescriptorHandler) override {
    return nullptr;
  }

  // Runs tasks until none is ready; returns how many ran.
  int runReady() {
    int ran = 0;
    while (!ready_.empty()) {
      Task task = std::move(ready_.front());
      ready_.pop_front();
      running_ = true;
      task();
      running_ = false;
      ++ran;
    }
    return ran;
  }
  // Runs the first ready task only; false when there is none.
  bool runOne() {
    if (ready_.empty()) return false;
    Task task = std::move(ready_.front());
    ready_.pop_front();
    running_ = true;
    task();
    running_ = false;
    return true;
  }
  std::size_t pending() const noexcept { return ready_.size(); }

 private:
  class ManualTimer;
  ManualClock& clock_;
  const std::string label_;
  const QualityOfService qualityOfService_;
  std::deque<Task> ready_;
  std::shared_ptr<void> alive_ = std::make_shared<int>(0);
  bool running_ = false;
};

class ManualWorkQueue::ManualTimer final : public WorkQueue::Timer {
 public:
  ManualTimer(ManualWorkQueue& queue, std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
              Task handler)
      : queue_(queue),
        clock_(queue.clock_),
        first_(first),
        interval_(interval),
        handler_(std::make_shared<Task>(std::move(handler))) {}
  ~ManualTimer() override { cancel(); }
  bool activate() override {
    if (queue_.timers == Timers::cannotBeArmed) return false;
    if (!active_) {
      active_ = true;
      arm(first_);
    }
    return true;
  }
  void cancel() noexcept override {
    if (!active_) return;
    active_ = false;
    clock_.cancel(id_);
    alive_.reset();
  }

 private:
  void arm(std::chrono::nanoseconds delay) {
    id_ = clock_.schedule(delay, [this] {
      if (interval_.count() > 0) {
        arm(interval_);
      }
      if (std::exchange(*isWaiting_, true)) return;  // ticks that could not run yet become one
      queue_.post([handler = handler_, isWaiting = isWaiting_, alive = std::weak_ptr<void>(alive_)] {
        *isWaiting = false;
        if (!alive.expired()) (*handler)();
      });
    });
  }
  ManualWorkQueue& queue_;
  ManualClock& clock_;  // a timer may be destroyed after its queue
  const std::chrono::nanoseconds first_;
  const std::chrono::nanoseconds interval_;
  const std::shared_ptr<Task> handler_;
  const std::shared_ptr<bool> isWaiting_ = std::make_shared<bool>(false);  // a tick is posted
  std::shared_ptr<void> alive_ = std::make_shared<int>(0);
  std::pair<ManualClock::Time, std::uint64_t> id_;
  bool active_ = false;
};

inline std::unique_ptr<WorkQueue::Timer> ManualWorkQueue::makeTimer(std::chrono::nanoseconds first,
                                                                    std::chrono::nanoseconds interval,
                                                                    std::chrono::nanoseconds leeway,
                                                                    Task handler) {
  leeways.push_back(leeway);
  if (timers == Timers::cannotBeMade) return nullptr;
  return std::make_unique<ManualTimer>(*this, first, interval, std::move(handler));
}

// Makes manual queues, keeps the serial ones it made for the test to run, and watches invented processes.
class ManualWorkQueues final : public WorkQueues {
 public:
  explicit ManualWorkQueues(ManualClock& clock)
      : clock_(clock), main_(clock, "main"), global_(clock, "global") {}

  ManualWorkQueue& main() noexcept override { return main_; }
  ManualWorkQueue& global() override { return global_; }
  std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService qualityOfService) override {
    auto queue = std::make_shared<ManualWorkQueue>(clock_, std::move(label), qualityOfService);
    serial.push_back(queue);
    return queue;
  }
  std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t pid, std::uint32_t startTime,
                                                           WorkQueue::Task onExit,
                                                           WorkQueue::Task onCancel) override;

  // The process exits: its sources tell so on global().
  void processExits(pid_t pid);
  // How many active sources watch the process.
  std::size_t watchersOf(pid_t pid) const { return watched_.count(pid); }

  std::vector<std::shared_ptr<ManualWorkQueue>> serial;
  bool refuseProcessExitSources = false;

 private:
  class ManualProcessExitSource;
  ManualClock& clock_;
  ManualWorkQueue main_;
  ManualWorkQueue global_;
  std::multimap<pid_t, ManualProcessExitSource*> watched_;
};

class ManualWorkQueues::ManualProcessExitSource final : public ProcessExitSource {
 public:
  ManualProcessExitSource(ManualWorkQueues& queues, pid_t pid, WorkQueue::Task onExit,
                          WorkQueue::Task onCancel)
      : queues_(queues), pid_(pid), onExit_(std::move(onExit)), onCancel_(std::move(onCancel)) {}
  ~ManualProcessExitSource() override { forget(); }
  void activate() override { queues_.watched_.emplace(pid_, this); }
  void cancel() noexcept override {
    forget();
    if (onCancel_) queues_.global_.post(std::exchange(onCancel_, {}));
  }
  const WorkQueue::Task& onExit() const { return onExit_; }

 private:
  void forget() noexcept {
    for (auto it = queues_.watched_.begin(); it != queues_.watched_.end();) {
      it = it->second == this ? queues_.watched_.erase(it) : std::next(it);
    }
  }
  ManualWorkQueues& queues_;
  const pid_t pid_;
  WorkQueue::Task onExit_;
  WorkQueue::Task onCancel_;
};

inline std::unique_ptr<ProcessExitSource> ManualWorkQueues::makeProcessExitSource(pid_t pid, std::uint32_t,
                                                                                  WorkQueue::Task onExit,
                                                                                  WorkQueue::Task onCancel) {
  if (refuseProcessExitSources) return nullptr;
  return std::make_unique<ManualProcessExitSource>(*this, pid, std::move(onExit), std::move(onCancel));
}

inline void ManualWorkQueues::processExits(pid_t pid) {
  const auto [first, last] = watched_.equal_range(pid);
  for (auto it = first; it != last; ++it) global_.post(it->second->onExit());
}

// A run loop whose timers follow a manual clock and whose descriptors are ready when a test says so.
class ManualRunLoop final : public RunLoop {
 public:
  explicit ManualRunLoop(ManualClock& clock) : clock_(clock) {}

  // Runs `whenRun` once (the test's script of events), then reports what became of it.
  RunResult run(std::chrono::duration<double>, ReturnAfterSource) override {
    ++runs;
    if (whenRun) whenRun();
    return std::exchange(stopped_, false) ? RunResult::stopped : RunResult::handledSource;
  }
  void stop() noexcept override {
    ++stops;
    stopped_ = true;
  }
  std::unique_ptr<DescriptorSource> addDescriptor(int fd, Interest interest,
                                                  DescriptorHandler handler) override;
  std::unique_ptr<LoopSource> addTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                       std::function<void()> handler, std::function<void()> failed) override;

  // Reports it on a watched descriptor; false when nobody watches it.
  bool makeReady(int fd, Readiness readiness) {
    const auto it = descriptors_.find(fd);
    if (it == descriptors_.end()) return false;
    const auto handler = it->second.second;
    handler(readiness);
    return true;
  }
  // The interest in a watched descriptor; none when nobody watches it.
  std::optional<Interest> interestIn(int fd) const {
    const auto it = descriptors_.find(fd);
    return it == descriptors_.end() ? std::nullopt : std::optional(it->second.first);
  }
  std::size_t timers() const noexcept { return timers_; }

  std::function<void()> whenRun;
  int runs = 0;
  int stops = 0;
  bool refuseTimers = false;
  bool failTimersLater = false;             // each is made, and then cannot be armed
  std::function<void()> lastTimersHandler;  // for a firing that was on its way when its timer ended
  bool refuseDescriptors = false;

 private:
  class ManualDescriptor;
  class ManualTimer;
  ManualClock& clock_;
  std::map<int, std::pair<Interest, DescriptorHandler>> descriptors_;
  std::size_t timers_ = 0;
  bool stopped_ = false;
};

class ManualRunLoop::ManualDescriptor final : public DescriptorSource {
 public:
  ManualDescriptor(ManualRunLoop& loop, int fd) : loop_(loop), fd_(fd) {}
  ~ManualDescriptor() override { invalidate(); }
  void invalidate() noexcept override {
    if (std::exchange(valid_, false)) loop_.descriptors_.erase(fd_);
  }
  bool setInterest(Interest interest) noexcept override {
    if (!valid_) return false;
    loop_.descriptors_[fd_].first = interest;
    return true;
  }

 private:
  ManualRunLoop& loop_;
  const int fd_;
  bool valid_ = true;
};

class ManualRunLoop::ManualTimer final : public LoopSource {
 public:
  ManualTimer(ManualRunLoop& loop, std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
              std::function<void()> handler)
      : loop_(loop),
        interval_(interval),
        handler_(std::make_shared<std::function<void()>>(std::move(handler))) {
    ++loop_.timers_;
    arm(first);
  }
  ~ManualTimer() override { invalidate(); }
  void invalidate() noexcept override {
    if (!std::exchange(valid_, false)) return;
    loop_.clock_.cancel(id_);
    --loop_.timers_;
  }

 private:
  void arm(std::chrono::nanoseconds delay) {
    id_ = loop_.clock_.schedule(delay, [this] {
      if (interval_.count() > 0) arm(interval_);
      const auto handler = handler_;
      (*handler)();
    });
  }
  ManualRunLoop& loop_;
  const std::chrono::nanoseconds interval_;
  const std::shared_ptr<std::function<void()>> handler_;
  std::pair<ManualClock::Time, std::uint64_t> id_;
  bool valid_ = true;
};

inline std::unique_ptr<DescriptorSource> ManualRunLoop::addDescriptor(int fd, Interest interest,
                                                                      DescriptorHandler handler) {
  if (refuseDescriptors) return nullptr;
  descriptors_[fd] = {interest, std::move(handler)};
  return std::make_unique<ManualDescriptor>(*this, fd);
}

inline std::unique_ptr<LoopSource> ManualRunLoop::addTimer(std::chrono::nanoseconds first,
                                                           std::chrono::nanoseconds interval,
                                                           std::function<void()> handler,
                                                           std::function<void()> failed) {
  if (refuseTimers) return nullptr;
  lastTimersHandler = handler;
  if (failTimersLater) {
    using std::chrono::nanoseconds;
    return std::make_unique<ManualTimer>(*this, nanoseconds(0), nanoseconds(0), std::move(failed));
  }
  return std::make_unique<ManualTimer>(*this, first, interval, std::move(handler));
}

}  // namespace brenvik
