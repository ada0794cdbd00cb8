// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <new>
#include <string>

#include "platform/runloop/RunLoop.h"

namespace brenvik {

// How urgent a queue's work is. `standard` gives its thread the priority of the process, whichever thread
// starts it; `utility` gives it nice 10 and the lowest best-effort I/O priority.
enum class QualityOfService { standard, utility };

// A serial queue: tasks run one at a time, in the order posted. Any thread that keeps the queue alive
// meanwhile may call any member. Destroying the last reference to a queue lets the running task finish, drops
// the tasks and timers that have not started, and joins the queue's thread (unless it is destroyed on that
// thread).
class WorkQueue {
 public:
  using Task = std::function<void()>;

  virtual ~WorkQueue() = default;

  virtual const std::string& label() const noexcept = 0;

  // Queues the task and returns. A task that throws std::bad_alloc is abandoned and logged; it must throw
  // nothing else. post() throws std::bad_alloc (OutOfQueues if the queue's thread cannot be started), and has
  // then queued nothing.
  virtual void post(Task task) = 0;

  // Runs the task once, `delay` from now (on a clock that counts while the system sleeps). It cannot be
  // cancelled. Throws as post() does. If no timer can be made, the task runs at once.
  virtual void postAfter(std::chrono::nanoseconds delay, Task task) = 0;

  // A timer whose handler runs on this queue: first after `first`, then every `interval`; each may be late by
  // up to `leeway`, so that wake-ups coincide. Several ticks while the handler runs become one. The timer is
  // inactive until activated. Null if it cannot be made. Throws as post() does.
  class Timer {
   public:
    virtual ~Timer() = default;  // cancels
    // Returns false if the system cannot time it, so that it will never fire. Called on another thread than
    // the queue's, it may return true and still fail later. Throws std::bad_alloc.
    virtual bool activate() = 0;
    virtual void cancel() noexcept = 0;
  };
  virtual std::unique_ptr<Timer> makeTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                           std::chrono::nanoseconds leeway, Task handler) = 0;

  // True on the thread (or within the manual run) that runs this queue's tasks.
  virtual bool isCurrent() const noexcept = 0;

  // Watches a descriptor on this queue, level-triggered, for drivers of libraries that poll. Call it, and
  // destroy the source, on the queue itself. Returns null if the kernel refuses or the queue has no
  // descriptors (fakes). Throws std::bad_alloc.
  virtual std::unique_ptr<DescriptorSource> watchDescriptor(int fd, Interest interest,
                                                            RunLoop::DescriptorHandler handler) = 0;
};

// Watches one process and calls its handler once, on WorkQueues::global(), after the process has exited.
class ProcessExitSource {
 public:
  virtual ~ProcessExitSource() = default;  // cancels without calling the cancel handler
  // Begins to watch. Throws std::bad_alloc, and then watches nothing.
  virtual void activate() = 0;
  // Stops watching. The cancel handler then runs once, on the queue.
  virtual void cancel() noexcept = 0;
};

// The system has no descriptor, thread or memory left for a queue. It derives from bad_alloc, so code that
// handles a lack of memory handles this, too.
class OutOfQueues : public std::bad_alloc {
 public:
  const char* what() const noexcept override { return "no descriptor or thread is left for a work queue"; }
};

// Makes queues. Any thread.
class WorkQueues {
 public:
  virtual ~WorkQueues() = default;

  // The queue served by the main thread's run loop.
  virtual WorkQueue& main() noexcept = 0;

  // The process-wide default-priority queue for short handlers. Throws OutOfQueues.
  virtual WorkQueue& global() = 0;

  // Makes a serial queue with a thread of its own, which starts with the first task. Never returns null.
  // Throws OutOfQueues, and so may the first post().
  virtual std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService qualityOfService) = 0;

  // Watches the process `pid` with this `version` (ProcessFacts::startTime in platform/base/ProcessFacts.h),
  // which tells it from other processes that had the same id. The event handler runs on global(), once the
  // main run loop runs. It also runs if that process has already gone, if the id now belongs to another
  // process, and if the system cannot watch it. Returns null if the kernel has no descriptor for it. Throws
  // std::bad_alloc.
  virtual std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t pid, std::uint32_t version,
                                                                   WorkQueue::Task onExit,
                                                                   WorkQueue::Task onCancel) = 0;
};

}  // namespace brenvik
