// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <span>
#include <utility>

#include "platform/base/UniqueFd.h"
#include "platform/worker/WorkerMessage.h"

namespace brenvik {

// One end of a pair of connected AF_UNIX SOCK_SEQPACKET sockets. Closing it hangs up; the other end can still
// read the messages that were sent before. Each object belongs to one thread at a time.
class WorkerChannel {
 public:
  // No channel: sending and receiving return `closed`.
  WorkerChannel() = default;
  WorkerChannel(WorkerChannel&&) noexcept = default;
  WorkerChannel& operator=(WorkerChannel&& other) noexcept;
  ~WorkerChannel() { close(); }
  explicit WorkerChannel(UniqueFd socket) noexcept : socket_(std::move(socket)) {}

  // Makes two connected ends, close-on-exec. Returns `outOfMemory` if there are no descriptors left.
  static WorkerResult makePair(WorkerChannel* one, WorkerChannel* other) noexcept;

  // Never blocks; returns `full` if the other end has not read enough. The caller still owns the descriptors.
  WorkerResult send(const WorkerMessage& message) noexcept;

  // Waits for the next message until the deadline; after the deadline it only looks once.
  // `time_point::max()`: for ever. A malformed message is dropped with its descriptors, and the result is
  // `malformed`.
  WorkerResult receive(WorkerMessage* message, std::chrono::steady_clock::time_point deadline) noexcept;

  // The same for a payload of at most kShortPayload bytes; a longer one is malformed. Takes little stack,
  // whose pages the process would keep.
  WorkerResult receiveShort(WorkerMessage* message, std::chrono::steady_clock::time_point deadline) noexcept;

  // For an event loop: readable when receive() would not wait. The channel owns it.
  int descriptor() const noexcept { return socket_.get(); }
  bool isOpen() const noexcept { return socket_.isValid(); }
  void close() noexcept;
  // Call it if the other end may be hostile: it may send descriptors whose last close blocks for as long as
  // it likes. Descriptors of unread or malformed messages are then closed on another thread. While too many
  // wait for that, receive() returns `unavailable`, and the message stays in the socket.
  void distrust() noexcept { isDistrusted_ = true; }
  // False while receive() would return `unavailable` for that reason.
  static bool hasRoomToDistrust() noexcept;
  // Closes a message's unexpected descriptors in the same way.
  void discard(WorkerMessage* message) noexcept;
  // Gives up the socket; the caller then owns it.
  UniqueFd release() noexcept { return std::move(socket_); }

  // The number of the worker that it leads to; each new worker gets the next one. For implementations of
  // Worker.
  std::uint64_t generation() const noexcept { return generation_; }
  void setGeneration(std::uint64_t generation) noexcept { generation_ = generation; }

 private:
  WorkerResult receiveInto(std::span<std::byte> bytes, WorkerMessage* message,
                           std::chrono::steady_clock::time_point deadline) noexcept;

  UniqueFd socket_;
  std::uint64_t generation_ = 0;
  bool isDistrusted_ = false;
};

// Whether a descriptor is a connected socket of a channel's kind.
bool isChannelSocket(int fd) noexcept;

}  // namespace brenvik
