// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>

namespace brenvik {

// A descriptor or a timer that a run loop or a work queue watches. Destroying or invalidating it ends the
// watching; its handler does not run again afterwards. Both may be done within the handler.
class LoopSource {
 public:
  virtual ~LoopSource() = default;
  virtual void invalidate() noexcept = 0;
};

// The events of a descriptor that a watcher waits for. A hang-up and an error are always reported as well.
enum class Interest : std::uint8_t { none, reading, writing, readingAndWriting };

constexpr Interest interestIn(bool reading, bool writing) noexcept {
  if (reading) return writing ? Interest::readingAndWriting : Interest::reading;
  return writing ? Interest::writing : Interest::none;
}

// The events of a watched descriptor.
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
  // Returns false if the kernel refuses; the interest then stays as it was. Loop thread only.
  virtual bool setInterest(Interest interest) noexcept = 0;
};

enum class RunResult : std::int32_t {
  finished = 1,       // nothing to wait for
  stopped = 2,        // stop() was called
  timedOut = 3,       // the time-out passed
  handledSource = 4,  // a source was handled, and the caller asked to return after that
};

enum class ReturnAfterSource : bool { no, yes };

// The event loop of one thread: it serves descriptors, timers, and the main queue
// (platform/runloop/WorkQueue.h). Unless a member says otherwise, call it on the loop's own thread only.
class RunLoop {
 public:
  using DescriptorHandler = std::function<void(Readiness)>;

  virtual ~RunLoop() = default;

  // Runs the sources until stopped, timed out, or (if asked) until one source was handled. `timeOut` is in
  // seconds; a value beyond the clock's range, such as the largest finite double, means no time-out.
  virtual RunResult run(std::chrono::duration<double> timeOut, ReturnAfterSource returnAfterSource) = 0;

  // Makes the current run() return, or the next one if none is under way. Any thread.
  virtual void stop() noexcept = 0;

  // Watches a descriptor, level-triggered. The caller still owns the descriptor, which must outlive the
  // source. Returns null if the kernel refuses. Throws std::bad_alloc.
  virtual std::unique_ptr<DescriptorSource> addDescriptor(int fd, Interest interest,
                                                          DescriptorHandler handler) = 0;

  // Makes a repeating timer: first after `first`, then every `interval` (zero: once only). Descriptors that
  // are ready at the same moment are served before it. Returns null if it cannot be made. Any thread may make
  // and destroy it. If another thread than the loop's makes it, arming may fail later; then `failed` runs on
  // the loop's thread instead of the handler. Throws std::bad_alloc.
  virtual std::unique_ptr<LoopSource> addTimer(std::chrono::nanoseconds first,
                                               std::chrono::nanoseconds interval,
                                               std::function<void()> handler,
                                               std::function<void()> failed) = 0;
};

}  // namespace brenvik
