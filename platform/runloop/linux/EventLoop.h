// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/runloop/RunLoop.h"
#include "platform/runloop/linux/TimerHeap.h"

namespace brenvik {

// One thread's loop with an inbox that any thread may post to; what the main run loop and every work queue
// stand on. It wakes for its sources and its inbox and for nothing else. All of them are in one epoll(7) set:
// the watched descriptors, an eventfd for the inbox and one timerfd for all timers, which is set to the first
// of them before the loop waits.
//
// The thread that calls runOnce() is the loop's thread.
class EventLoop : public std::enable_shared_from_this<EventLoop> {
 public:
  // Which thread owns the loop before its first runOnce(): the one that makes it, or one to be started. A
  // loop for another thread takes all the descriptors that it needs for itself at once; this thread's takes
  // the last of them, the clock's, with its first timer.
  enum class For { thisThread, anotherThread };
  static constexpr int kDescriptors = 3;

  // Null when the system is out of descriptors or memory.
  static std::shared_ptr<EventLoop> make(For whom);
  ~EventLoop();
  EventLoop(const EventLoop&) = delete;
  EventLoop& operator=(const EventLoop&) = delete;

  // Waits for one source and handles it: 1 when one was handled, 0 when the time passed or a signal came,
  // negative errno. Ready descriptors take turns. A timer that is due comes after the descriptors that are
  // ready at the same moment, and before their next turn. `timeOut` in microseconds; UINT64_MAX: none.
  int runOnce(std::uint64_t timeOut) noexcept;

  // Any thread. May throw std::bad_alloc; a task that throws it is given up, with a line in the log.
  void post(std::function<void()> task);
  // Makes a waiting runOnce() return. Any thread, async-signal-safe.
  void wake() noexcept;
  // Whether this is the loop's thread: before the first runOnce(), see For.
  bool onLoopThread() const noexcept;

  // Loop thread only.
  std::unique_ptr<DescriptorSource> addDescriptor(int fd, Interest interest,
                                                  RunLoop::DescriptorHandler handler);

  // A timer that may be made, armed and destroyed on any thread. `failed` runs on the loop's thread when it
  // could not be armed there. Null when it could not be made at once.
  std::unique_ptr<LoopSource> addTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                       std::chrono::nanoseconds leeway, std::function<void()> handler,
                                       std::function<void()> failed);

  // Runs the task once, later. A task that cannot be put off runs at once: too early is better than never.
  // Any thread.
  void postAfter(std::chrono::nanoseconds delay, std::function<void()> task);

 private:
  struct Timer;
  class TimerHandle;
  class Descriptor;
  class DescriptorSet;

  EventLoop() = default;
  void drainInbox() noexcept;
  bool makeClock();
  void setClock() noexcept;
  int handleOwn() noexcept;
  bool handleReady(void* entry, std::uint32_t events) noexcept;
  bool handleTimer() noexcept;
  bool arm(const std::shared_ptr<Timer>& timer) noexcept;
  void disarm(Timer& timer) noexcept;

  std::shared_ptr<DescriptorSet> descriptors_;
  UniqueFd wakeFd_;
  std::unique_ptr<DescriptorSource> wakeSource_;
  UniqueFd clockFd_;
  std::unique_ptr<DescriptorSource> clockSource_;
  const void* clockEntry_ = nullptr;  // what epoll knows it by
  // Loop thread only: the timers that run; what the timerfd is set to; and whether it has been seen to be
  // due, so that it is the timers' turn when it comes round again.
  TimerHeap<Timer> timers_;
  std::uint64_t clockIsSetTo_ = UINT64_MAX;
  bool clockWasSeenDue_ = false;
  // Loop thread only: the inbox holds what the thread has posted to itself, which takes no wake-up; and it is
  // that inbox's turn, after a descriptor had its own.
  bool hasOwnTasks_ = false;
  bool ownTasksAreNext_ = false;
  std::atomic<std::thread::id> thread_;  // none: not started
  std::mutex inboxMutex_;
  std::vector<std::function<void()>> inbox_;
};

}  // namespace brenvik
