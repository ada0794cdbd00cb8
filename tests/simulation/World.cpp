// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "World.h"

#include <algorithm>

namespace brenvik::simulation {
// ---- queues ----

SimulatedQueue::SimulatedQueue(World& world, std::string label, QualityOfService qualityOfService)
    : world_(world), tasks_(world.clock, std::move(label), qualityOfService) {
  world_.queues_.push_back(this);
}

SimulatedQueue::~SimulatedQueue() { world_.join(*this); }

bool SimulatedQueue::isCurrent() const noexcept { return world_.current_ == this; }

void World::join(SimulatedQueue& queue) {
  // The running task ends first; others go on meanwhile, but for the main loop, which waits here.
  while (queue.state_ != SimulatedQueue::State::idle) {
    if (isKilled_) {
      runTask(queue);
    } else if (!step(false)) {
      break;
    }
  }
  std::erase(queues_, &queue);
  if (!queue.thread_.joinable()) return;
  queue.isToEnd_ = true;
  handOver(queue);
  queue.thread_.join();
}

// Gives the turn to a queue's thread until it gives it back.
void World::handOver(SimulatedQueue& queue) {
  std::unique_lock lock(mutex_);
  isOutersTurn_ = false;
  queue.isItsTurn_ = true;
  queue.turn_.notify_one();
  outerTurn_.wait(lock, [this] { return isOutersTurn_; });
}

void World::serveThread(SimulatedQueue& queue) {
  for (;;) {
    {
      std::unique_lock lock(mutex_);
      queue.turn_.wait(lock, [&queue] { return queue.isItsTurn_; });
      queue.isItsTurn_ = false;
    }
    if (!queue.isToEnd_) {
      (void)queue.tasks_.runOne();
      queue.state_ = SimulatedQueue::State::idle;
    }
    const std::lock_guard lock(mutex_);
    isOutersTurn_ = true;
    outerTurn_.notify_one();
    if (queue.isToEnd_) return;
  }
}

void World::runTask(SimulatedQueue& queue) {
  SimulatedQueue* const before = std::exchange(current_, &queue);
  queue.isWoken_ = false;
  if (queue.state_ == SimulatedQueue::State::idle) queue.isOnThread_ = mayWait(queue.label());
  queue.state_ = SimulatedQueue::State::running;
  if (queue.isOnThread_) {
    if (!queue.thread_.joinable()) queue.thread_ = std::thread([this, &queue] { serveThread(queue); });
    handOver(queue);
  } else {
    (void)queue.tasks_.runOne();
    queue.state_ = SimulatedQueue::State::idle;
  }
  current_ = before;
}

void World::waitFor(Time delay) {
  SimulatedQueue* const queue = current_;
  if (isKilled_ || queue == nullptr || !queue->isOnThread_) return;
  queue->state_ = SimulatedQueue::State::waiting;
  const auto wake = clock.schedule(delay, [queue] { queue->isWoken_ = true; });
  std::unique_lock lock(mutex_);
  isOutersTurn_ = true;
  outerTurn_.notify_one();
  queue->turn_.wait(lock, [queue] { return queue->isItsTurn_; });
  queue->isItsTurn_ = false;
  clock.cancel(wake);  // a kill ends the wait early, and then the queue
}

void World::endWaits() noexcept {
  for (SimulatedQueue* each : queues_) each->isWoken_ = each->state_ == SimulatedQueue::State::waiting;
}

const std::string& World::actor() const noexcept { return current_ != nullptr ? current_->label() : actor_; }

bool World::isQuiet(std::string_view label) const noexcept {
  return std::none_of(queues_.begin(), queues_.end(), [label](const SimulatedQueue* each) {
    return each->label() == label &&
           (each->tasks_.pending() > 0 || each->state_ != SimulatedQueue::State::idle);
  });
}

// ---- the scheduler ----

bool World::step(bool withMain) {
  // What can go on at this moment goes on before time does, in an order that the seed decides.
  std::vector<SimulatedQueue*> ready;
  for (SimulatedQueue* each : queues_) {
    if (each->canRun()) ready.push_back(each);
  }
  const std::size_t loop = withMain && !loopEvents_.empty() ? 1 : 0;
  const std::size_t main = withMain && mainTasks_->pending() > 0 ? 1 : 0;
  const std::size_t global = globalTasks_->pending() > 0 ? 1 : 0;
  const std::size_t choices = ready.size() + loop + main + global;
  if (choices == 0) {
    const bool isSomething = clock.runNext();
    if (withMain && afterEachStep) afterEachStep();
    return isSomething;
  }
  std::size_t choice = choices == 1 ? 0 : random_.below(choices);
  if (choice < ready.size()) {
    runTask(*ready[choice]);
  } else if ((choice -= ready.size()) < loop) {
    const auto event = std::move(loopEvents_.front());
    loopEvents_.pop_front();
    handledMain_ = true;
    event();
  } else if ((choice -= loop) < main) {
    handledMain_ = true;
    actor_ = "main tasks";
    (void)mainTasks_->runOne();
    actor_ = "main";
  } else {
    actor_ = "global";
    (void)globalTasks_->runOne();
    actor_ = "main";
  }
  if (withMain && afterEachStep) afterEachStep();
  return true;
}

RunResult World::runLoopOnce() {
  handledMain_ = false;
  try {
    while (!std::exchange(isLoopStopped_, false)) {
      if (isKilled_) throw Killed();
      if (!step(true)) throw Finding{"nothing will ever happen again, and the helper waits"};
      if (handledMain_ && !isKilled_) return RunResult::handledSource;
    }
  } catch (...) {
    kill();
    endThreads();
    throw;
  }
  return RunResult::stopped;
}

// ---- lives ----

void World::beginLife() {
  isKilled_ = false;
  isLoopStopped_ = false;
  mainTasks_ = std::make_unique<ManualWorkQueue>(clock, "main");
  globalTasks_ = std::make_unique<ManualWorkQueue>(clock, "global");
}

void World::endThreads() {
  const auto isAtWork = [](const SimulatedQueue* each) {
    return each->state_ != SimulatedQueue::State::idle;
  };
  for (auto found = queues_.begin();
       (found = std::find_if(queues_.begin(), queues_.end(), isAtWork)) != queues_.end();) {
    runTask(**found);
  }
}

void World::endLife() {
  loopEvents_.clear();
  mainTasks_ = std::make_unique<ManualWorkQueue>(clock, "main");
  globalTasks_ = std::make_unique<ManualWorkQueue>(clock, "global");
  if (!queues_.empty()) throw Finding{"the queue \"" + queues_[0]->label() + "\" outlives the helper"};
}

// ---- process exits ----

class SimulatedQueues::ExitSource final : public ProcessExitSource {
 public:
  ExitSource(SimulatedQueues& queues, Key key, WorkQueue::Task onExit, WorkQueue::Task onCancel)
      : queues_(queues), key_(key), onExit_(std::move(onExit)), onCancel_(std::move(onCancel)) {}
  ~ExitSource() override { forget(); }
  void activate() override {
    queues_.watched_.emplace(key_, this);
    // One that has gone already is told of as well.
    if (!queues_.isAlive(key_.first, key_.second)) tell();
  }
  void cancel() noexcept override {
    forget();
    if (onCancel_) queues_.global().post(std::exchange(onCancel_, {}));
  }
  void tell() { queues_.global().post(onExit_); }

 private:
  void forget() noexcept {
    std::erase_if(queues_.watched_, [this](const auto& each) { return each.second == this; });
  }
  SimulatedQueues& queues_;
  const Key key_;
  const WorkQueue::Task onExit_;
  WorkQueue::Task onCancel_;
};

std::unique_ptr<ProcessExitSource> SimulatedQueues::makeProcessExitSource(pid_t pid, std::uint32_t version,
                                                                          WorkQueue::Task onExit,
                                                                          WorkQueue::Task onCancel) {
  return std::make_unique<ExitSource>(*this, Key{pid, version}, std::move(onExit), std::move(onCancel));
}

void SimulatedQueues::processExits(pid_t pid, std::uint32_t version) {
  const auto [first, last] = watched_.equal_range({pid, version});
  for (auto each = first; each != last; ++each) each->second->tell();
}

// ---- timers of the main loop ----

class SimulatedRunLoop::Timer final : public LoopSource {
 public:
  Timer(SimulatedRunLoop& loop, Time first, Time interval, std::function<void()> handler)
      : loop_(loop), interval_(interval), handler_(std::move(handler)) {
    ++loop_.timers;
    arm(first);
  }
  ~Timer() override { invalidate(); }
  void invalidate() noexcept override {
    if (alive_ == nullptr) return;
    alive_.reset();
    loop_.world_.clock.cancel(id_);
    --loop_.timers;
  }

 private:
  void arm(Time delay) {
    id_ = loop_.world_.clock.schedule(delay, [this] {
      if (interval_.count() > 0) arm(interval_);
      loop_.world_.postToLoop([alive = std::weak_ptr<int>(alive_), handler = handler_] {
        if (!alive.expired()) handler();
      });
    });
  }
  SimulatedRunLoop& loop_;
  const Time interval_;
  const std::function<void()> handler_;
  std::shared_ptr<int> alive_ = std::make_shared<int>(0);
  std::pair<Time, std::uint64_t> id_;
};

std::unique_ptr<LoopSource> SimulatedRunLoop::addTimer(std::chrono::nanoseconds first,
                                                       std::chrono::nanoseconds interval,
                                                       std::function<void()> handler, std::function<void()>) {
  if (refuseTimers) return nullptr;
  return std::make_unique<Timer>(*this, first, interval, std::move(handler));
}

}  // namespace brenvik::simulation
