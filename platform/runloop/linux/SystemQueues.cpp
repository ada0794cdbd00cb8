// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/runloop/linux/SystemQueues.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/epoll.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <mutex>
#include <thread>
#include <utility>

#include "platform/base/ProcessStartTime.h"

namespace brenvik {
namespace {

constexpr std::uint64_t kNoTimeOut = UINT64_MAX;

// Of linux/ioprio.h, which Debian's headers do not install for user space: best effort, lowest of its levels.
constexpr int kIoPriorityWhoProcess = 1;
constexpr int kIoPriorityUtility = (2 << 13) | 7;
constexpr int kNiceUtility = 10;

void applyQualityOfService(QualityOfService qualityOfService) noexcept {
  if (qualityOfService != QualityOfService::utility) return;
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
  void activate() override {
    const std::lock_guard hold(lock_);
    if (source_ != nullptr) return;
    source_ = loop_->addTimer(first_, interval_, leeway_, handler_, {});
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
    loop_->post(std::move(task));
  }
  void postAfter(std::chrono::nanoseconds delay, Task task) override {
    start();
    loop_->postAfter(delay, std::move(task));
  }
  std::unique_ptr<Timer> makeTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                   std::chrono::nanoseconds leeway, Task handler) override {
    start();
    return std::make_unique<QueueTimer>(loop_, first, interval, leeway, std::move(handler));
  }
  bool isCurrent() const noexcept override { return loop_->onLoopThread(); }
  std::unique_ptr<DescriptorSource> watchDescriptor(int fd, std::uint32_t events,
                                                    RunLoop::DescriptorHandler handler) override {
    return loop_->addDescriptor(fd, events, std::move(handler));
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
  ThreadQueue(std::shared_ptr<EventLoop> loop, std::string label, QualityOfService qualityOfService)
      : SystemQueue(std::move(loop), std::move(label)),
        qualityOfService_(qualityOfService),
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
      thread_ = std::thread([loop = loop_, quit = quit_, qualityOfService = qualityOfService_] {
        applyQualityOfService(qualityOfService);
        while (!quit->load()) {
          if (loop->runOnce(kNoTimeOut) < 0) break;
        }
      });
      // The kernel keeps 15 characters.
      (void)::pthread_setname_np(thread_.native_handle(), label().substr(0, 15).c_str());
    });
  }

 private:
  const QualityOfService qualityOfService_;
  const std::shared_ptr<std::atomic<bool>> quit_;
  std::once_flag started_;
  std::thread thread_;
};

class PidfdExitSource final : public ProcessExitSource {
 public:
  PidfdExitSource(std::weak_ptr<WorkQueue> queue, UniqueFd pidfd, WorkQueue::Task onExit,
                  WorkQueue::Task onCancel)
      : queue_(std::move(queue)), state_(std::make_shared<State>()) {
    state_->pidfd = std::move(pidfd);
    state_->onExit = std::move(onExit);
    state_->onCancel = std::move(onCancel);
  }
  ~PidfdExitSource() override { end(false); }

  void activate() override {
    const auto queue = queue_.lock();
    if (queue == nullptr) return;
    queue->post([state = state_, weak = queue_] {
      const auto self = weak.lock();
      if (state->cancelled.load() || self == nullptr) return;
      if (!state->pidfd.isValid()) return tell(state);  // it was gone before it could be watched
      state->source = self->watchDescriptor(state->pidfd.get(), EPOLLIN, [state](std::uint32_t) {
        state->source.reset();
        tell(state);
      });
    });
  }
  void cancel() noexcept override { end(true); }

 private:
  struct State {
    std::atomic<bool> cancelled{false};
    WorkQueue::Task onExit;
    WorkQueue::Task onCancel;
    UniqueFd pidfd;
    std::unique_ptr<DescriptorSource> source;  // queue only
  };
  static void tell(const std::shared_ptr<State>& state) {
    if (!state->cancelled.load()) state->onExit();
  }
  void end(bool withHandler) noexcept {
    if (state_->cancelled.exchange(true)) return;
    const auto queue = queue_.lock();
    if (queue == nullptr) {
      state_->source.reset();  // its thread has ended; the source's handler holds the state
      return;
    }
    queue->post([state = state_, withHandler] {
      state->source.reset();
      if (withHandler && state->onCancel) state->onCancel();
    });
  }
  const std::weak_ptr<WorkQueue> queue_;
  const std::shared_ptr<State> state_;
};

}  // namespace

std::unique_ptr<SystemRunLoop> SystemRunLoop::make() {
  auto loop = EventLoop::make();
  if (loop == nullptr) return nullptr;
  return std::unique_ptr<SystemRunLoop>(new SystemRunLoop(std::move(loop)));
}

RunResult SystemRunLoop::run(std::chrono::duration<double> timeOut, ReturnAfterSource returnAfterSource) {
  using Clock = std::chrono::steady_clock;
  // Beyond a century there is no time-out; the largest finite double would not fit the clock's count.
  const bool endless = !(timeOut < std::chrono::hours(24 * 36525));
  const auto deadline = endless ? Clock::time_point::max()
                                : Clock::now() + std::chrono::duration_cast<Clock::duration>(timeOut);
  for (;;) {
    if (stopped_.exchange(false)) return RunResult::stopped;
    std::uint64_t wait = kNoTimeOut;
    if (!endless) {
      const auto left = std::chrono::ceil<std::chrono::microseconds>(deadline - Clock::now());
      wait = left.count() <= 0 ? 0 : static_cast<std::uint64_t>(left.count());
    }
    const int handled = loop_->runOnce(wait);
    if (stopped_.exchange(false)) return RunResult::stopped;
    if (handled < 0) return RunResult::finished;
    if (handled > 0 && returnAfterSource == ReturnAfterSource::yes) return RunResult::handledSource;
    if (handled == 0 && wait == 0) return RunResult::timedOut;
  }
}

void SystemRunLoop::stop() noexcept {
  stopped_.store(true);
  loop_->wake();
}

std::unique_ptr<DescriptorSource> SystemRunLoop::addDescriptor(int fd, std::uint32_t events,
                                                               DescriptorHandler handler) {
  return loop_->addDescriptor(fd, events, std::move(handler));
}

std::unique_ptr<LoopSource> SystemRunLoop::addTimer(std::chrono::nanoseconds first,
                                                    std::chrono::nanoseconds interval,
                                                    std::function<void()> handler,
                                                    std::function<void()> failed) {
  return loop_->addTimer(first, interval, std::chrono::nanoseconds::zero(), std::move(handler),
                         std::move(failed));
}

SystemQueues::SystemQueues(SystemRunLoop& mainLoop)
    : mainLoop_(mainLoop.eventLoop()), main_(std::make_unique<SystemQueue>(mainLoop_, "main")) {}

SystemQueues::~SystemQueues() = default;

WorkQueue& SystemQueues::main() noexcept { return *main_; }

WorkQueue& SystemQueues::global() noexcept {
  std::call_once(globalMade_, [this] { global_ = makeSerial("global", QualityOfService::standard); });
  return *global_;
}

std::shared_ptr<WorkQueue> SystemQueues::makeSerial(std::string label, QualityOfService qualityOfService) {
  auto loop = EventLoop::make();
  // Out of descriptors: the work still has to happen somewhere, so it runs on the main queue.
  if (loop == nullptr) return std::make_shared<SystemQueue>(mainLoop_, std::move(label));
  return std::make_shared<ThreadQueue>(std::move(loop), std::move(label), qualityOfService);
}

std::unique_ptr<ProcessExitSource> SystemQueues::makeProcessExitSource(pid_t pid, std::uint32_t startTime,
                                                                       WorkQueue::Task onExit,
                                                                       WorkQueue::Task onCancel) {
  UniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0U)));
  if (!pidfd.isValid() && errno != ESRCH) return nullptr;
  // The id may have been given to another process since the caller learned it.
  if (pidfd.isValid() && processStartTime(pid) != startTime) pidfd.reset();
  global();
  return std::make_unique<PidfdExitSource>(global_, std::move(pidfd), std::move(onExit), std::move(onCancel));
}

}  // namespace brenvik
