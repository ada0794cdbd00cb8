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

// One thread's loop, with an inbox that any thread may post to. The main run loop and every work queue are
// built on it. It wakes only for its sources and its inbox. One epoll(7) set holds the watched descriptors,
// an eventfd for the inbox and one timerfd for all timers, which is set to the earliest timer before the loop
// waits.
//
// The thread that calls runOnce() is the loop's thread.
class EventLoop : public std::enable_shared_from_this<EventLoop> {
 public:
  // Which thread owns the loop before its first runOnce(): the one that makes it, or one that is started
  // later. A loop for another thread opens all its own descriptors at once; a loop for this thread opens the
  // timerfd with its first timer.
  enum class For { thisThread, anotherThread };
  static constexpr int kDescriptors = 3;

  // Returns null if the system is out of descriptors or memory.
  static std::shared_ptr<EventLoop> make(For whom);
  ~EventLoop();
  EventLoop(const EventLoop&) = delete;
  EventLoop& operator=(const EventLoop&) = delete;

  // Waits for one source and handles it. Returns 1 if one was handled, 0 if the time passed or a signal
  // arrived, else a negative errno. Ready descriptors take turns. A timer that is due runs after the
  // descriptors that are ready at the same moment, and before their next turn. `timeOut` is in microseconds;
  // UINT64_MAX: none.
  int runOnce(std::uint64_t timeOut) noexcept;

  // Any thread. May throw std::bad_alloc; a task that throws it is abandoned and logged.
  void post(std::function<void()> task);
  // Makes a waiting runOnce() return. Any thread, async-signal-safe.
  void wake() noexcept;
  // Whether this is the loop's thread; before the first runOnce(), see For.
  bool onLoopThread() const noexcept;

  // Loop thread only.
  std::unique_ptr<DescriptorSource> addDescriptor(int fd, Interest interest,
                                                  RunLoop::DescriptorHandler handler);

  // A timer that any thread may make, arm and destroy. `failed` runs on the loop's thread if it could not be
  // armed there. Returns null if it could not be made.
  std::unique_ptr<LoopSource> addTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                       std::chrono::nanoseconds leeway, std::function<void()> handler,
                                       std::function<void()> failed);

  // Runs the task once, later. If no timer can be made, it runs at once: too early is better than never. Any
  // thread.
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
