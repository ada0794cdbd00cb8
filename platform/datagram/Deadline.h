// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <compare>
#include <ctime>

namespace brenvik {

// The point in time, on CLOCK_MONOTONIC, at which a wait ends.
class Deadline {
 public:
  using Clock = std::chrono::steady_clock;

  // `time_point::max()`: never.
  explicit Deadline(Clock::time_point end) noexcept : end_(end) {}
  static Deadline in(std::chrono::milliseconds time) noexcept { return Deadline(Clock::now() + time); }
  static Deadline never() noexcept { return Deadline(Clock::time_point::max()); }
  static Deadline past() noexcept { return Deadline(Clock::time_point(std::chrono::nanoseconds(1))); }

  bool isNever() const noexcept { return end_ == Clock::time_point::max(); }
  bool hasPassed() const noexcept { return !isNever() && Clock::now() >= end_; }
  // The time left, as poll(2) takes it: milliseconds rounded up, 0 after the deadline, -1 for never.
  int millisecondsForPoll() const noexcept;
  // The time of CLOCK_MONOTONIC, as timerfd_settime(2) takes it; zero for never.
  timespec forTimer() const noexcept;
  auto operator<=>(const Deadline&) const noexcept = default;

 private:
  Clock::time_point end_;
};

// Waits until the descriptor is ready for the poll(2) `events` or has hung up. Returns 0, ETIMEDOUT, or the
// errno of poll(2). After the deadline it still looks once.
int waitFor(int descriptor, short events, Deadline deadline) noexcept;

}  // namespace brenvik
