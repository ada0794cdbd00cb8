// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/runloop/linux/SystemQueues.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <exception>
#include <functional>
#include <future>
#include <mutex>
#include <system_error>
#include <thread>
#include <utility>

#include "platform/base/ProcessFacts.h"
#include "platform/log/LogContext.h"

namespace brenvik {
namespace {

constexpr std::uint64_t kNoTimeOut = UINT64_MAX;

// Of linux/ioprio.h, which Debian's headers do not install for user space: best effort, lowest of its levels.
constexpr int kIoPriorityWhoProcess = 1;
constexpr int kIoPriorityUtility = (2 << 13) | 7;
constexpr int kNiceUtility = 10;

// A thread begins with the priority of the one that makes it, and may not raise its own without a capability.
thread_local bool isLowered = false;

void applyQualityOfService(QualityOfService qualityOfService) noexcept {
  if (qualityOfService != QualityOfService::utility) return;
  isLowered = true;
  const auto self = static_cast<id_t>(::syscall(SYS_gettid));
  // Both are courtesies: without them the work is done all the same.
  (void)::setpriority(PRIO_PROCESS, self, kNiceUtility);
  (void)::syscall(SYS_ioprio_set, kIoPriorityWhoProcess, 0, kIoPriorityUtility);
}

// A timer that is armed when it is activated; shared by the main queue and the queues with threads.
class QueueTimer final : public WorkQueue::Timer {
 public:
  QueueTimer(std::shared_ptr<EventLoop> loop, std::chrono::nanoseconds first,
             std::chrono::nanoseconds interval, std::chrono::nanoseconds leeway, WorkQueue::Task handler)
      : loop_(std::move(loop)),
        first_(first),
        interval_(interval),
        leeway_(leeway),
        handler_(std::move(handler)) {}
  bool activate() override {
    const std::lock_guard hold(lock_);
    if (source_ == nullptr) source_ = loop_->addTimer(first_, interval_, leeway_, handler_, {});
    return source_ != nullptr;
  }
  void cancel() noexcept override {
    const std::lock_guard hold(lock_);
    source_.reset();
  }

 private:
  const std::shared_ptr<EventLoop> loop_;
  const std::chrono::nanoseconds first_;
  const std::chrono::nanoseconds interval_;
  const std::chrono::nanoseconds leeway_;
  const WorkQueue::Task handler_;
  std::mutex lock_;  // the first firing may cancel before activate() has returned on its thread
  std::unique_ptr<LoopSource> source_;
};

class SystemQueue : public WorkQueue {
 public:
  SystemQueue(std::shared_ptr<EventLoop> loop, std::string label)
      : loop_(std::move(loop)), label_(std::move(label)) {}

  const std::string& label() const noexcept override { return label_; }
  void post(Task task) override {
    start();
    loop_->post(inCurrentLogContext(std::move(task)));
  }
  void postAfter(std::chrono::nanoseconds delay, Task task) override {
    start();
    loop_->postAfter(delay, inCurrentLogContext(std::move(task)));
  }
  std::unique_ptr<Timer> makeTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                   std::chrono::nanoseconds leeway, Task handler) override {
    start();
    return std::make_unique<QueueTimer>(loop_, first, interval, leeway,
                                        inCurrentLogContext(std::move(handler)));
  }
  bool isCurrent() const noexcept override { return loop_->onLoopThread(); }
  std::unique_ptr<DescriptorSource> watchDescriptor(int fd, Interest interest,
                                                    RunLoop::DescriptorHandler handler) override {
    return loop_->addDescriptor(fd, interest, std::move(handler));
  }

 protected:
  virtual void start() {}
  const std::shared_ptr<EventLoop> loop_;

 private:
  const std::string label_;
};

// A queue with a thread of its own, started by its first task.
class ThreadQueue final : public SystemQueue {
 public:
  // A queue of standard quality, whose thread can make others of that quality; null where there is none.
  using StandardQueue = std::function<std::shared_ptr<WorkQueue>()>;

  ThreadQueue(std::shared_ptr<EventLoop> loop, std::string label, QualityOfService qualityOfService,
              StandardQueue standardQueue)
      : SystemQueue(std::move(loop), std::move(label)),
        qualityOfService_(qualityOfService),
        standardQueue_(std::move(standardQueue)),
        quit_(std::make_shared<std::atomic<bool>>(false)) {}

  ~ThreadQueue() override {
    quit_->store(true);
    loop_->wake();
    if (!thread_.joinable()) return;
    if (thread_.get_id() == std::this_thread::get_id()) {
      thread_.detach();  // it ends when the task that destroyed the queue returns
    } else {
      thread_.join();
    }
  }

 protected:
  void start() override {
    std::call_once(started_, [this] {
      try {
        if (qualityOfService_ == QualityOfService::utility && !isLowered) prepareForLoweredMakers();
        thread_ = qualityOfService_ == QualityOfService::standard && isLowered ? makeStandardThread()
                                                                               : makeThread();
      } catch (const std::system_error&) {
        throw OutOfQueues();
      }
    });
  }

 private:
  std::thread makeThread() {
    // The kernel keeps 15 characters of a name. A thread that names itself needs no descriptor for that.
    return std::thread(
        [loop = loop_, quit = quit_, qualityOfService = qualityOfService_, name = label().substr(0, 15)] {
          (void)::pthread_setname_np(::pthread_self(), name.c_str());
          applyQualityOfService(qualityOfService);
          while (!quit->load()) {
            if (loop->runOnce(kNoTimeOut) < 0) break;
          }
        });
  }

  // Before there is a first thread of low priority: has a thread of the standard one run, which makes those
  // that a low one asks for.
  void prepareForLoweredMakers() const noexcept try {
    if (const auto maker = standardQueue_()) maker->post([] {});
  } catch (const std::bad_alloc&) {
    // The work of those threads is done all the same, later.
  }

  std::thread makeStandardThread() {
    const auto made = std::make_shared<std::promise<std::thread>>();
    try {
      const auto maker = standardQueue_();
      if (maker == nullptr || maker.get() == this) return makeThread();
      maker->post([this, made] {
        try {
          made->set_value(makeThread());
        } catch (...) {
          made->set_exception(std::current_exception());
        }
      });
    } catch (const std::bad_alloc&) {
      return makeThread();  // a slow one is better than none
    }
    return made->get_future().get();
  }

  const QualityOfService qualityOfService_;
  const StandardQueue standardQueue_;
  const std::shared_ptr<std::atomic<bool>> quit_;
  std::once_flag started_;
  std::thread thread_;
};

// The process's limit of descriptors, raised while this stands by what queues need; not beyond the hard
// limit.
class RaisedLimit {
 public:
  RaisedLimit() noexcept {
    if (::getrlimit(RLIMIT_NOFILE, &before_) != 0) return;
    rlimit raised = before_;
    raised.rlim_cur = std::min(before_.rlim_cur + SystemQueues::kReservedDescriptors, before_.rlim_max);
    raised_ = raised.rlim_cur > before_.rlim_cur && ::setrlimit(RLIMIT_NOFILE, &raised) == 0;
  }
  // What was made above the limit stays.
  ~RaisedLimit() {
    if (raised_) (void)::setrlimit(RLIMIT_NOFILE, &before_);
  }
  RaisedLimit(const RaisedLimit&) = delete;
  RaisedLimit& operator=(const RaisedLimit&) = delete;

 private:
  rlimit before_{};
  bool raised_ = false;
};

}  // namespace

// Makes the serial queues and, when it is first wanted, the global one.
class SystemQueues::Maker : public std::enable_shared_from_this<Maker> {
 public:
  std::shared_ptr<WorkQueue> make(std::string label, QualityOfService qualityOfService) {
    auto loop = EventLoop::make(EventLoop::For::anotherThread);
    if (loop == nullptr) {
      static std::mutex oneAtATime;  // the limit is the process's
      const std::lock_guard lock(oneAtATime);
      const RaisedLimit limit;
      loop = EventLoop::make(EventLoop::For::anotherThread);
    }
    if (loop == nullptr) throw OutOfQueues();
    const auto standardQueue = [weak = weak_from_this()]() -> std::shared_ptr<WorkQueue> {
      const auto self = weak.lock();
      return self != nullptr ? self->sharedGlobal() : nullptr;
    };
    return std::make_shared<ThreadQueue>(std::move(loop), std::move(label), qualityOfService, standardQueue);
  }
  WorkQueue& global() { return *sharedGlobal(); }

 private:
  std::shared_ptr<WorkQueue> sharedGlobal() {
    const std::lock_guard lock(mutex_);
    if (global_ == nullptr) global_ = make("global", QualityOfService::standard);
    return global_;
  }

  std::mutex mutex_;
  std::shared_ptr<WorkQueue> global_;
};

static_assert(SystemQueues::kReservedDescriptors == 12 * EventLoop::kDescriptors,
              "as many queues as the helper ever has at a time");

namespace {

class PidfdExitSource final : public ProcessExitSource {
 public:
  // `onGlobal` runs a task on the global queue, or drops it when there is none any more. Without `pidfd` the
  // process has gone.
  PidfdExitSource(const std::shared_ptr<EventLoop>& loop, std::function<void(WorkQueue::Task)> onGlobal,
                  pid_t pid, std::uint32_t startTime, UniqueFd pidfd, WorkQueue::Task onExit,
                  WorkQueue::Task onCancel)
      : loop_(loop), state_(std::make_shared<State>()) {
    state_->onGlobal = std::move(onGlobal);
    state_->pid = pid;
    state_->startTime = startTime;
    state_->pidfd = std::move(pidfd);
    state_->onExit = std::move(onExit);
    state_->onCancel = std::move(onCancel);
  }
  ~PidfdExitSource() override { end(false); }

  // Never within this call: who was let in waits for an answer, and for that none of this is needed.
  void activate() override {
    const auto alive = loop_.lock();
    if (alive == nullptr) return;
    alive->post([state = state_, weak = loop_] {
      const auto loop = weak.lock();
      if (state->cancelled.load() || loop == nullptr) return;
      // The id may have been given to another process between the caller's look and the opening.
      if (!state->pidfd.isValid() || processStartTime(state->pid) != state->startTime) return tell(state);
      try {
        state->source = loop->addDescriptor(state->pidfd.get(), Interest::reading, [state](Readiness) {
          state->source.reset();
          tell(state);
        });
      } catch (const std::bad_alloc&) {
        // As without a source.
      }
      // What would never be heard of is better told too early: nobody relies on it any more.
      if (state->source == nullptr) tell(state);
    });
  }
  void cancel() noexcept override { end(true); }

 private:
  struct State {
    std::atomic<bool> cancelled{false};
    std::atomic<bool> told{false};
    std::function<void(WorkQueue::Task)> onGlobal;
    WorkQueue::Task onExit;
    WorkQueue::Task onCancel;
    pid_t pid = 0;
    std::uint32_t startTime = 0;
    UniqueFd pidfd;
    std::unique_ptr<DescriptorSource> source;  // loop thread only
  };
  static void tell(const std::shared_ptr<State>& state) {
    state->told.store(true);
    const auto exited = [state] {
      if (!state->cancelled.load()) state->onExit();
    };
    try {
      state->onGlobal(exited);
    } catch (const std::bad_alloc&) {
      exited();  // the handlers are short, and nobody would tell once more
    }
  }
  void onLoop(WorkQueue::Task task) {
    const auto loop = loop_.lock();
    if (loop == nullptr) return;
    if (loop->onLoopThread()) {
      task();
    } else {
      loop->post(std::move(task));
    }
  }
  void end(bool withHandler) noexcept {
    if (state_->cancelled.exchange(true)) return;
    // An exit that was told is watched no more: the loop need not wake up for it.
    if (!state_->told.load()) {
      if (loop_.expired()) state_->source.reset();  // its handler holds the state
      try {
        onLoop([state = state_] { state->source.reset(); });
      } catch (const std::bad_alloc&) {
        // The exit lets go of it, untold.
      }
    }
    if (!withHandler || !state_->onCancel) return;
    try {
      state_->onGlobal([state = state_] { state->onCancel(); });
    } catch (const std::bad_alloc&) {
      state_->onCancel();
    }
  }
  const std::weak_ptr<EventLoop> loop_;
  const std::shared_ptr<State> state_;
};

}  // namespace

std::unique_ptr<SystemRunLoop> SystemRunLoop::make() {
  auto loop = EventLoop::make(EventLoop::For::thisThread);
  if (loop == nullptr) return nullptr;
  return std::unique_ptr<SystemRunLoop>(new SystemRunLoop(std::move(loop)));
}

RunResult SystemRunLoop::run(std::chrono::duration<double> timeOut, ReturnAfterSource returnAfterSource) {
  using Clock = std::chrono::steady_clock;
  // Beyond a century there is no time-out; the largest finite double would not fit the clock's count.
  const bool endless = !(timeOut < std::chrono::hours(24 * 36525));
  const auto deadline = endless ? Clock::time_point::max()
                                : Clock::now() + std::chrono::duration_cast<Clock::duration>(timeOut);
  // Looked at first: each call that is served passes here twice, and an exchange waits for the memory bus.
  const auto takeStop = [this] { return stopped_.load() && stopped_.exchange(false); };
  for (;;) {
    if (takeStop()) return RunResult::stopped;
    std::uint64_t wait = kNoTimeOut;
    if (!endless) {
      const auto left = std::chrono::ceil<std::chrono::microseconds>(deadline - Clock::now());
      wait = left.count() <= 0 ? 0 : static_cast<std::uint64_t>(left.count());
    }
    const int handled = loop_->runOnce(wait);
    if (takeStop()) return RunResult::stopped;
    if (handled < 0) return RunResult::finished;
    if (handled > 0 && returnAfterSource == ReturnAfterSource::yes) return RunResult::handledSource;
    if (handled == 0 && wait == 0) return RunResult::timedOut;
  }
}

void SystemRunLoop::stop() noexcept {
  stopped_.store(true);
  loop_->wake();
}

std::unique_ptr<DescriptorSource> SystemRunLoop::addDescriptor(int fd, Interest interest,
                                                               DescriptorHandler handler) {
  return loop_->addDescriptor(fd, interest, std::move(handler));
}

std::unique_ptr<LoopSource> SystemRunLoop::addTimer(std::chrono::nanoseconds first,
                                                    std::chrono::nanoseconds interval,
                                                    std::function<void()> handler,
                                                    std::function<void()> failed) {
  return loop_->addTimer(first, interval, std::chrono::nanoseconds::zero(), std::move(handler),
                         std::move(failed));
}

SystemQueues::SystemQueues(SystemRunLoop& mainLoop)
    : mainLoop_(mainLoop.eventLoop()),
      main_(std::make_unique<SystemQueue>(mainLoop_, "main")),
      maker_(std::make_shared<Maker>()) {}

SystemQueues::~SystemQueues() = default;

WorkQueue& SystemQueues::main() noexcept { return *main_; }

WorkQueue& SystemQueues::global() { return maker_->global(); }

std::shared_ptr<WorkQueue> SystemQueues::makeSerial(std::string label, QualityOfService qualityOfService) {
  return maker_->make(std::move(label), qualityOfService);
}

std::unique_ptr<ProcessExitSource> SystemQueues::makeProcessExitSource(pid_t pid, std::uint32_t startTime,
                                                                       WorkQueue::Task onExit,
                                                                       WorkQueue::Task onCancel) {
  UniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0U)));
  if (!pidfd.isValid() && errno != ESRCH) return nullptr;
  const auto onGlobal = [weak = std::weak_ptr<Maker>(maker_),
                         weakLoop = std::weak_ptr<EventLoop>(mainLoop_)](WorkQueue::Task task) {
    const auto maker = weak.lock();
    if (maker == nullptr) return;
    try {
      maker->global().post(task);
    } catch (const OutOfQueues&) {
      // These handlers are short: the main queue bears them.
      if (const auto loop = weakLoop.lock()) loop->post(std::move(task));
    }
  };
  return std::make_unique<PidfdExitSource>(mainLoop_, onGlobal, pid, startTime, std::move(pidfd),
                                           std::move(onExit), std::move(onCancel));
}

}  // namespace brenvik
