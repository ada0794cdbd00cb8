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

// How urgent a queue's work is: `standard` gives the thread the priority of the process, whichever thread
// starts it; `utility` gives it nice 10 and the lowest best-effort I/O priority.
enum class QualityOfService { standard, utility };

// A serial queue: tasks run one at a time, in the order posted. All members may be called from any thread
// that keeps the queue alive meanwhile. Destroying the last reference to a queue lets the task that runs
// finish, drops the tasks and timers that have not started, and joins the queue's thread (unless it is
// destroyed on that very thread).
class WorkQueue {
 public:
  using Task = std::function<void()>;

  virtual ~WorkQueue() = default;

  virtual const std::string& label() const noexcept = 0;

  // Queues the task and returns. A task that throws std::bad_alloc is given up, with a line in the log; it
  // must throw nothing else. Throws std::bad_alloc (OutOfQueues when the queue's thread cannot be started)
  // and has then queued nothing.
  virtual void post(Task task) = 0;

  // Runs the task once, `delay` from now (a clock that counts while the system sleeps). It cannot be
  // cancelled. Throws as post() does. When the delay cannot be timed, the task runs at once.
  virtual void postAfter(std::chrono::nanoseconds delay, Task task) = 0;

  // A timer whose handler runs on this queue: first after `first`, then every `interval`; a firing may be put
  // off by up to `leeway` so that wake-ups coincide. Ticks that fall while the handler runs become one. The
  // timer is inactive until activated. Null when it cannot be made. Throws as post() does.
  class Timer {
   public:
    virtual ~Timer() = default;  // cancels
    // False when the system cannot time it, so that it will never fire; off the queue that is not known yet.
    // Throws std::bad_alloc.
    virtual bool activate() = 0;
    virtual void cancel() noexcept = 0;
  };
  virtual std::unique_ptr<Timer> makeTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                           std::chrono::nanoseconds leeway, Task handler) = 0;

  // True on the thread (or within the manual run) that runs this queue's tasks.
  virtual bool isCurrent() const noexcept = 0;

  // Watches a descriptor on this queue, level-triggered: for drivers of libraries that poll. To be called and
  // destroyed on the queue itself. Null when the kernel refused or the queue has no descriptors (fakes).
  // Throws std::bad_alloc.
  virtual std::unique_ptr<DescriptorSource> watchDescriptor(int fd, Interest interest,
                                                            RunLoop::DescriptorHandler handler) = 0;
};

// Watches one process and tells, once, on the queue it was made with, that it has exited.
class ProcessExitSource {
 public:
  virtual ~ProcessExitSource() = default;  // cancels without calling the cancel handler
  // Begins to watch. Throws std::bad_alloc, and then watches nothing.
  virtual void activate() = 0;
  // Ends the watching. The cancel handler runs once, afterwards, on the queue.
  virtual void cancel() noexcept = 0;
};

// The system has no descriptor, thread or memory left for a queue. A kind of bad_alloc: whoever copes with
// lack of memory copes with this.
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

  // A new serial queue; its thread starts with its first task. Never null, and never a queue that shares its
  // thread with another: throws OutOfQueues, as the posting of the first task may.
  virtual std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService qualityOfService) = 0;

  // Watches the process `pid` of that version: ids are used again, and the version tells one process from the
  // others that had its id (processStartTime() in platform/base/ProcessFacts.h). The event handler runs on
  // global(), once the main run loop runs. It also runs when that process is gone already, when the id names
  // another process, and when the system lacks what it takes to watch it. Null when the kernel gives no
  // descriptor for it. Throws std::bad_alloc.
  virtual std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t pid, std::uint32_t version,
                                                                   WorkQueue::Task onExit,
                                                                   WorkQueue::Task onCancel) = 0;
};

}  // namespace brenvik
