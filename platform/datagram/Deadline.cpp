// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/datagram/Deadline.h"

#include <poll.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdint>

namespace brenvik {

int Deadline::millisecondsForPoll() const noexcept {
  if (isNever()) return -1;
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(end_ - Clock::now()).count();
  return static_cast<int>(std::clamp<std::int64_t>(left, 0, INT_MAX));
}

timespec Deadline::forTimer() const noexcept {
  if (isNever()) return {};
  // steady_clock is CLOCK_MONOTONIC on Linux.
  const auto time = std::chrono::duration_cast<std::chrono::nanoseconds>(end_.time_since_epoch()).count();
  return {time / 1'000'000'000, time % 1'000'000'000};
}

int waitFor(int descriptor, short events, Deadline deadline) noexcept {
  for (;;) {
    pollfd entry{descriptor, events, 0};
    const int ready = ::poll(&entry, 1, deadline.millisecondsForPoll());
    if (ready > 0) return 0;
    if (ready < 0 && errno != EINTR) return errno;
    if (deadline.hasPassed()) return ETIMEDOUT;
  }
}

}  // namespace brenvik
