// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/uio.h>

#include <array>
#include <chrono>
#include <compare>
#include <cstddef>
#include <cstdint>
#include <ctime>
#include <span>

#include "platform/base/UniqueFd.h"

// Datagrams over SOCK_SEQPACKET sockets, with a point in time after which nothing waits any longer.
namespace brenvik::client {

class Deadline {
 public:
  static Deadline in(std::chrono::milliseconds time) noexcept { return Deadline(Clock::now() + time); }
  static Deadline never() noexcept { return Deadline(Clock::time_point::max()); }
  static Deadline past() noexcept { return Deadline(Clock::time_point(std::chrono::nanoseconds(1))); }

  bool hasPassed() const noexcept { return end_ != Clock::time_point::max() && Clock::now() >= end_; }
  // What is left, as poll(2) takes it: rounded up, 0 when it has passed, -1 when there is none.
  int millisecondsForPoll() const noexcept;
  // The time of CLOCK_MONOTONIC, as timerfd_settime(2) takes it; zero when there is none.
  timespec forTimer() const noexcept;
  auto operator<=>(const Deadline&) const noexcept = default;

 private:
  using Clock = std::chrono::steady_clock;
  explicit Deadline(Clock::time_point end) noexcept : end_(end) {}
  Clock::time_point end_;
};

enum class Io : std::uint8_t {
  done,
  timedOut,
  closed,  // the peer has closed its end
  reset,   // the same, and it left messages of ours unread
  failed,  // see errno
};

// More than any message of the protocol carries.
inline constexpr std::size_t kMaxDescriptors = 4;

struct Incoming {
  std::size_t length = 0;
  bool isCut = false;  // bytes or control data did not fit: no correct message
  std::array<UniqueFd, kMaxDescriptors> descriptors;
  std::size_t descriptorCount = 0;
};

// How a wait is made: by poll, or by the socket's own SO_RCVTIMEO, which saves a system call and is only good
// for one wait of that length; or not at all, and then what would have waited has timed out.
enum class Waiting : std::uint8_t { byPoll, bySocketOption, never };

// Sends one datagram whole or not at all. `closed` and `reset`: nothing was delivered. When it had to wait
// for room, *next becomes byPoll; when it is `never`, it does not wait.
Io sendMessage(int socket, std::span<const iovec> parts, std::span<const int> descriptors, Deadline deadline,
               Waiting* next) noexcept;

// Receives one datagram. An empty one counts as the end of the channel. Descriptors arrive close-on-exec;
// what a message should not carry is closed.
Io receiveMessage(int socket, std::span<std::byte> buffer, Deadline deadline, Waiting waiting,
                  Incoming* incoming) noexcept;

// Waits until the descriptor is ready for the poll(2) events or has hung up.
Io waitFor(int descriptor, short events, Deadline deadline) noexcept;

}  // namespace brenvik::client
