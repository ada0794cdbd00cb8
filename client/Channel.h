// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/uio.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/base/UniqueFd.h"
#include "platform/datagram/Deadline.h"

// The client's side of a channel: sends and receives datagrams (platform/datagram) and waits for them until a
// deadline.
namespace brenvik::client {

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
  bool isCut = false;  // bytes or descriptors did not fit: no correct message
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

}  // namespace brenvik::client
