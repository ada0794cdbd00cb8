// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "platform/worker/WorkerChannel.h"

namespace brenvik {

// The helper's side of a worker: a separate program with fewer rights that does work for the helper. Any
// thread.
class Worker {
 public:
  virtual ~Worker() = default;

  // Opens a channel for one piece of work; `work` is the worker's number for the kind of work. Connects to
  // the worker or starts it if needed, and never waits: if the worker does not start, the channel hangs up or
  // stays silent. Closing the channel cancels the work; if the worker dies, all of its channels hang up.
  virtual WorkerResult open(std::uint32_t work, WorkerChannel* channel) noexcept = 0;

  // Connects to the worker or starts it, so that the next open() finds it at work. Does nothing if it is
  // there already. Like open(), it never waits. It logs nothing: a worker that cannot be reached is an error
  // of the open() that needs it.
  virtual void start() noexcept = 0;

  // Closes the channel and ends its worker, because it missed its deadline, sent malformed data or hung up
  // too early. All channels of that worker hang up, and the next open() uses a new worker. If that worker has
  // already gone, it only closes the channel.
  virtual void giveUp(WorkerChannel* channel) noexcept = 0;
};

}  // namespace brenvik
