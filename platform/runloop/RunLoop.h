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

// What a watcher wants to know of a descriptor. Whatever it is, a hang-up and an error are reported as well.
enum class Interest : std::uint8_t { none, reading, writing, readingAndWriting };

constexpr Interest interestIn(bool reading, bool writing) noexcept {
  if (reading) return writing ? Interest::readingAndWriting : Interest::reading;
  return writing ? Interest::writing : Interest::none;
}

// What has become of a watched descriptor.
struct Readiness {
  bool isReadable = false;
  bool isWritable = false;
  bool hasHungUp = false;
  bool hasFailed = false;

  bool isOver() const noexcept { return hasHungUp || hasFailed; }
};

// A watched descriptor, whose interest can be changed.
class DescriptorSource : public LoopSource {
 public:
  // False when the kernel refused: then the interest is as before. Loop thread only.
  virtual bool setInterest(Interest interest) noexcept = 0;
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
  using DescriptorHandler = std::function<void(Readiness)>;

  virtual ~RunLoop() = default;

  // Runs the sources until stopped, timed out, or (when asked) until one source was handled. A time-out
  // beyond what the clock can say, the largest finite double included, means none. Seconds.
  virtual RunResult run(std::chrono::duration<double> timeOut, ReturnAfterSource returnAfterSource) = 0;

  // Makes the present run() return, or the next one when none is under way. Any thread.
  virtual void stop() noexcept = 0;

  // Watches a descriptor, level-triggered; the descriptor stays the caller's and must outlive the source.
  // Null when the kernel refused. Throws std::bad_alloc.
  virtual std::unique_ptr<DescriptorSource> addDescriptor(int fd, Interest interest,
                                                          DescriptorHandler handler) = 0;

  // A repeating timer: first after `first`, then every `interval` (zero: once only). Descriptors that are
  // ready at the same moment are served before it. Null when it cannot be made. Any thread, as is the
  // source's destruction; off the loop's thread the timer may still fail to be armed later, and then
  // `failed` runs on the loop's thread in the handler's place. Throws std::bad_alloc.
  virtual std::unique_ptr<LoopSource> addTimer(std::chrono::nanoseconds first,
                                               std::chrono::nanoseconds interval,
                                               std::function<void()> handler,
                                               std::function<void()> failed) = 0;
};

}  // namespace brenvik
