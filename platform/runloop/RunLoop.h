// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>

namespace brenvik {

// Something a run loop or a work queue watches: a descriptor or a timer. Destroying it, or invalidating it,
// ends the watching; its handler does not run again afterwards. Both may be done from within the handler.
class LoopSource {
 public:
  virtual ~LoopSource() = default;
  virtual void invalidate() noexcept = 0;
};

// A watched descriptor, whose interest can be changed.
class DescriptorSource : public LoopSource {
 public:
  // `events` is a mask of EPOLLIN and EPOLLOUT; EPOLLHUP and EPOLLERR are always reported. False when the
  // kernel refused. Loop thread only.
  virtual bool setEvents(std::uint32_t events) noexcept = 0;
};

enum class RunResult : std::int32_t {
  finished = 1,       // nothing to wait for
  stopped = 2,        // stop() was called
  timedOut = 3,       // the time-out passed
  handledSource = 4,  // a source was handled, and the caller asked to return after that
};

enum class ReturnAfterSource : bool { no, yes };

// The event loop of one thread: descriptors, timers, and (platform/runloop/WorkQueue.h) the main queue.
// Unless a member says otherwise, call it on the loop's own thread only.
class RunLoop {
 public:
  using DescriptorHandler = std::function<void(std::uint32_t events)>;

  virtual ~RunLoop() = default;

  // Runs the sources until stopped, timed out, or (when asked) until one source was handled. A time-out
  // beyond what the clock can say, the largest finite double included, means none. Seconds.
  virtual RunResult run(std::chrono::duration<double> timeOut, ReturnAfterSource returnAfterSource) = 0;

  // Makes the present run() return, or the next one when none is under way. Any thread.
  virtual void stop() noexcept = 0;

  // Watches a descriptor, level-triggered; the descriptor stays the caller's and must outlive the source.
  // Null when the kernel refused.
  virtual std::unique_ptr<DescriptorSource> addDescriptor(int fd, std::uint32_t events,
                                                          DescriptorHandler handler) = 0;

  // A repeating timer: first after `first`, then every `interval` (zero: once only). Descriptors that are
  // ready at the same moment are served before it. Null when it cannot be made. Any thread, as is the
  // source's destruction; off the loop's thread the timer may still fail to be armed later, and then
  // `failed` runs on the loop's thread in the handler's place.
  virtual std::unique_ptr<LoopSource> addTimer(std::chrono::nanoseconds first,
                                               std::chrono::nanoseconds interval,
                                               std::function<void()> handler,
                                               std::function<void()> failed) = 0;
};

}  // namespace brenvik
