// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <systemd/sd-event.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/runloop/RunLoop.h"

namespace brenvik {

// One thread's loop with an inbox that any thread may post to; what the main run loop and every work queue
// stand on. It wakes for its sources and its inbox and for nothing else. Timers are an sd_event(3) of its
// own; descriptors are in an epoll(7) set in which that one is, too, because going through sd_event costs a
// request 0.08 times the whole of a bare one.
//
// The thread that calls runOnce() is the loop's thread.
class EventLoop : public std::enable_shared_from_this<EventLoop> {
 public:
  // Whose the loop is before its first runOnce(): the maker's own, or another's that will be started. One for
  // another thread takes all the descriptors it will ever need at once, timers included.
  enum class For { thisThread, anotherThread };
  static constexpr int kDescriptorsForAnotherThread = 4;

  // Null when the system is out of descriptors or memory.
  static std::shared_ptr<EventLoop> make(For whom);
  ~EventLoop();
  EventLoop(const EventLoop&) = delete;
  EventLoop& operator=(const EventLoop&) = delete;

  // Waits for one source and handles it: 1 when one was handled, 0 when the time passed, negative errno.
  // Ready descriptors come before due timers, and each other in turn. `timeOut` in microseconds; UINT64_MAX:
  // none.
  int runOnce(std::uint64_t timeOut) noexcept;

  // Any thread. May throw std::bad_alloc; a task that throws it is given up, with a line in the log.
  void post(std::function<void()> task);
  // Makes a waiting runOnce() return. Any thread, async-signal-safe.
  void wake() noexcept;
  // Whether this is the loop's thread: before the first runOnce(), see For.
  bool onLoopThread() const noexcept;

  // Loop thread only.
  std::unique_ptr<DescriptorSource> addDescriptor(int fd, std::uint32_t events,
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
  bool makeTimers() noexcept;
  int handleTimer() noexcept;
  bool arm(const std::shared_ptr<Timer>& timer) noexcept;
  void disarm(Timer& timer) noexcept;
  static int onTime(sd_event_source* source, std::uint64_t due, void* userdata) noexcept;

  struct Unref {
    void operator()(sd_event* event) const noexcept { sd_event_unref(event); }
    void operator()(sd_event_source* source) const noexcept { sd_event_source_disable_unref(source); }
  };
  using SourcePointer = std::unique_ptr<sd_event_source, Unref>;

  std::shared_ptr<DescriptorSet> descriptors_;
  UniqueFd wakeFd_;
  std::unique_ptr<DescriptorSource> wakeSource_;
  // Loop thread only: made with the first timer; whether sd_event_prepare(3) has been called since the last
  // dispatch, and whether a timer has changed since then.
  std::unique_ptr<sd_event, Unref> timers_;
  std::unique_ptr<DescriptorSource> timersSource_;
  bool timersPrepared_ = false;
  bool timersChanged_ = false;
  // Loop thread only: the inbox holds what the thread has posted to itself, which takes no wake-up; and it is
  // that inbox's turn, after a descriptor had its own.
  bool hasOwnTasks_ = false;
  bool ownTasksAreNext_ = false;
  std::atomic<std::thread::id> thread_;  // none: not started
  std::mutex inboxMutex_;
  std::vector<std::function<void()>> inbox_;
  std::unordered_map<Timer*, std::shared_ptr<Timer>> armed_;  // loop thread only
};

}  // namespace brenvik
