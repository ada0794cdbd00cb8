// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstdint>
#include <utility>

#include "platform/base/UniqueFd.h"
#include "platform/worker/WorkerMessage.h"

namespace brenvik {

// One end of a pair of connected AF_UNIX SOCK_SEQPACKET sockets. Closing it hangs up; what the other end has
// not read yet it still can. Each object belongs to one thread at a time.
class WorkerChannel {
 public:
  // No channel: sending and receiving say `closed`.
  WorkerChannel() = default;
  WorkerChannel(WorkerChannel&&) noexcept = default;
  WorkerChannel& operator=(WorkerChannel&& other) noexcept;
  ~WorkerChannel() { close(); }
  explicit WorkerChannel(UniqueFd socket) noexcept : socket_(std::move(socket)) {}

  // Two ends that are connected to each other, closed on exec(2). `outOfMemory` when there are no
  // descriptors.
  static WorkerResult makePair(WorkerChannel* one, WorkerChannel* other) noexcept;

  // Never blocks: `full` when the other end has let too much pile up. The descriptors stay the caller's.
  WorkerResult send(const WorkerMessage& message) noexcept;

  // The next message, waited for until the deadline. A deadline that has passed: what is there already.
  // `time_point::max()`: for ever. A message that is `malformed` is dropped, with its descriptors.
  WorkerResult receive(WorkerMessage* message, std::chrono::steady_clock::time_point deadline) noexcept;

  // For an event loop: readable when receive() would not wait.
  int descriptor() const noexcept { return socket_.get(); }
  bool isOpen() const noexcept { return socket_.isValid(); }
  void close() noexcept;
  // The other end may be hostile: what it sends are perhaps descriptors whose last close waits for as long as
  // it likes. Those that arrive unread, or with what is no message, are closed on another thread. While
  // too many wait for that, receive() says `unavailable`, and the message stays where it is.
  void distrust() noexcept { isDistrusted_ = true; }
  // Whether receive() would not say so.
  static bool hasRoomToDistrust() noexcept;
  // Does the same with what came along with a message and was not asked for.
  void discard(WorkerMessage* message) noexcept;
  // Gives the socket away.
  UniqueFd release() noexcept { return std::move(socket_); }

  // Which worker it leads to, of all that there have been. For implementations of Worker.
  std::uint64_t generation() const noexcept { return generation_; }
  void setGeneration(std::uint64_t generation) noexcept { generation_ = generation; }

 private:
  UniqueFd socket_;
  std::uint64_t generation_ = 0;
  bool isDistrusted_ = false;
};

// Whether a descriptor is a connected socket of a channel's kind.
bool isChannelSocket(int fd) noexcept;

}  // namespace brenvik
