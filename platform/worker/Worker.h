// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "platform/worker/WorkerChannel.h"

namespace brenvik {

// A program beside this process that does work of one sort, with fewer rights. The helper's side. Any thread.
class Worker {
 public:
  virtual ~Worker() = default;

  // Opens a channel of its own for one piece of work; `work` says which sort, as the worker knows it.
  // Connects to the worker or starts it when needed, and waits for nothing: a worker that does not come up
  // shows as a channel that hangs up, or as one that nothing comes from. Closing the channel cancels the
  // work; when the worker dies, all of its channels hang up.
  virtual WorkerResult open(std::uint32_t work, WorkerChannel* channel) noexcept = 0;

  // Ends the worker of this channel, which is closed: it was too late, told nonsense, or hung up before its
  // time. All channels of that worker hang up, and the next open() has a new one. Nothing but the closing
  // when that worker is gone already.
  virtual void giveUp(WorkerChannel* channel) noexcept = 0;
};

}  // namespace brenvik
