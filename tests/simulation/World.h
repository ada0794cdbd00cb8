// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "platform/runloop/fakes/ManualRunLoop.h"

namespace brenvik::simulation {

using Time = std::chrono::nanoseconds;

// Numbers that follow from a seed alone (splitmix64), on every machine the same.
class Random {
 public:
  explicit Random(std::uint64_t seed) noexcept : state_(seed) {}
  std::uint64_t next() noexcept {
    std::uint64_t z = (state_ += 0x9E3779B97F4A7C15U);
    z = (z ^ (z >> 30U)) * 0xBF58476D1CE4E5B9U;
    z = (z ^ (z >> 27U)) * 0x94D049BB133111EBU;
    return z ^ (z >> 31U);
  }
  // 0 to count - 1; 0 for a count of 0.
  std::size_t below(std::size_t count) noexcept { return count == 0 ? 0 : next() % count; }
  bool oneIn(std::size_t count) noexcept { return below(count) == 0; }
  Time upTo(Time most) noexcept {
    return Time(static_cast<Time::rep>(below(static_cast<std::size_t>(most.count()) + 1)));
  }
  template <class Container>
  const auto& of(const Container& container) noexcept {
    return *(std::begin(container) + static_cast<std::ptrdiff_t>(below(std::size(container))));
  }

 private:
  std::uint64_t state_;
};

// What a history has shown to be wrong. Ends the history.
struct Finding {
  std::string text;
};

// The helper's process has been killed; thrown from its run loop.
struct Killed {};

class World;

// A serial queue of the helper. Its tasks run when the world lets them; a task that may wait for the network
// has a thread of its own, but only one thread of the world runs at a time.
class SimulatedQueue final : public WorkQueue {
 public:
  SimulatedQueue(World& world, std::string label, QualityOfService qualityOfService);
  SimulatedQueue(const SimulatedQueue&) = delete;
  SimulatedQueue& operator=(const SimulatedQueue&) = delete;
  ~SimulatedQueue() override;

  const std::string& label() const noexcept override { return tasks_.label(); }
  void post(Task task) override { tasks_.post(std::move(task)); }
  void postAfter(std::chrono::nanoseconds delay, Task task) override {
    tasks_.postAfter(delay, std::move(task));
  }
  std::unique_ptr<Timer> makeTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                   std::chrono::nanoseconds leeway, Task handler) override {
    return tasks_.makeTimer(first, interval, leeway, std::move(handler));
  }
  bool isCurrent() const noexcept override;
  std::unique_ptr<DescriptorSource> watchDescriptor(int, Interest, RunLoop::DescriptorHandler) override {
    return nullptr;
  }

 private:
  friend class World;
  bool canRun() const noexcept { return state_ == State::idle ? tasks_.pending() > 0 : isWoken_; }

  enum class State { idle, running, waiting };
  World& world_;
  ManualWorkQueue tasks_;
  bool isOnThread_ = false;  // the task that runs, or waits
  State state_ = State::idle;
  bool isWoken_ = false;  // a waiting task may go on
  // The thread, made for the first task.
  std::thread thread_;
  std::condition_variable turn_;
  bool isItsTurn_ = false;
  bool isToEnd_ = false;
};

// The clock, the threads and the scheduler of one history. The outer thread makes and drives it.
class World {
 public:
  explicit World(std::uint64_t seed) : random_(seed) {}
  World(const World&) = delete;
  World& operator=(const World&) = delete;

  ManualClock clock;
  Time now() const noexcept { return clock.now(); }

  // ---- the helper's main loop ----

  // Something that the main loop will handle: a message, the death of a port, a tick of a timer.
  void postToLoop(std::function<void()> event) { loopEvents_.push_back(std::move(event)); }
  // Runs until one event or task of the main loop was handled, or stop() was called, as the real loop does.
  RunResult runLoopOnce();
  void stopLoop() noexcept { isLoopStopped_ = true; }

  // ---- everything ----

  // One step of whatever can go on, the main loop only if `withMain`; false if nothing in the world ever
  // will.
  bool step(bool withMain);

  // Called on a queue's thread: lets the others go on for so long. It returns at once when the helper has
  // been killed.
  void waitFor(Time delay);
  // Ends the waits of all queues: what they wait for has gone.
  void endWaits() noexcept;
  // The label of the queue whose task runs, "main tasks" for a task of the main queue, else "main".
  const std::string& actor() const noexcept;
  // Whether no queue of the helper has anything to do.
  bool isQuiet(std::string_view label) const noexcept;

  // ---- the helper's death ----

  // From here on nothing that the helper does has an effect. Its code runs to where it gives way.
  void kill() noexcept { isKilled_ = true; }
  bool isKilled() const noexcept { return isKilled_; }
  // Lets killed tasks come to their ends, and drops those that have not started.
  void endThreads();
  // Before the helper starts.
  void beginLife();
  // After the helper has gone.
  void endLife();

  // Whether the tasks of this queue may wait now.
  std::function<bool(std::string_view label)> mayWait;
  // Asked in each step of the main loop whether the loop must give way to a new history.
  std::function<void()> afterEachStep;

  Random& random() noexcept { return random_; }
  ManualWorkQueue& mainTasks() { return *mainTasks_; }
  ManualWorkQueue& globalTasks() { return *globalTasks_; }

 private:
  friend class SimulatedQueue;
  void runTask(SimulatedQueue& queue);
  void handOver(SimulatedQueue& queue);
  void serveThread(SimulatedQueue& queue);
  void join(SimulatedQueue& queue);

  Random random_;
  std::unique_ptr<ManualWorkQueue> mainTasks_ = std::make_unique<ManualWorkQueue>(clock, "main");
  std::unique_ptr<ManualWorkQueue> globalTasks_ = std::make_unique<ManualWorkQueue>(clock, "global");
  std::deque<std::function<void()>> loopEvents_;
  bool isLoopStopped_ = false;
  bool isKilled_ = false;
  bool handledMain_ = false;
  std::vector<SimulatedQueue*> queues_;
  SimulatedQueue* current_ = nullptr;
  std::string actor_ = "main";

  // Threads of queues and the outer one take turns.
  std::mutex mutex_;
  std::condition_variable outerTurn_;
  bool isOutersTurn_ = true;
};

// The helper's queues.
class SimulatedQueues final : public WorkQueues {
 public:
  explicit SimulatedQueues(World& world) : world_(world) {}
  WorkQueue& main() noexcept override { return world_.mainTasks(); }
  WorkQueue& global() override { return world_.globalTasks(); }
  std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService qualityOfService) override {
    return std::make_shared<SimulatedQueue>(world_, std::move(label), qualityOfService);
  }
  std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t pid, std::uint32_t version,
                                                           WorkQueue::Task onExit,
                                                           WorkQueue::Task onCancel) override;
  // The process exits: its sources tell so on global().
  void processExits(pid_t pid, std::uint32_t version);
  // Whether this process, with this version, is there now.
  std::function<bool(pid_t pid, std::uint32_t version)> isAlive;
  std::size_t watched() const noexcept { return watched_.size(); }

 private:
  class ExitSource;
  using Key = std::pair<pid_t, std::uint32_t>;
  World& world_;
  std::multimap<Key, ExitSource*> watched_;
};

// The helper's run loop: the world goes on while the helper waits.
class SimulatedRunLoop final : public RunLoop {
 public:
  explicit SimulatedRunLoop(World& world) : world_(world) {}
  RunResult run(std::chrono::duration<double>, ReturnAfterSource) override { return world_.runLoopOnce(); }
  void stop() noexcept override { world_.stopLoop(); }
  std::unique_ptr<DescriptorSource> addDescriptor(int, Interest, DescriptorHandler) override {
    return nullptr;  // nothing here has a descriptor
  }
  std::unique_ptr<LoopSource> addTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                       std::function<void()> handler, std::function<void()> failed) override;
  int timers = 0;
  bool refuseTimers = false;

 private:
  class Timer;
  World& world_;
};

}  // namespace brenvik::simulation
