// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/un.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <span>

#include "client/Reply.h"

namespace brenvik::client {

// One client of the helper: its death-watch port, its channel, and one request at a time on it. One thread
// at a time. All results are codes of mobile_helper.h.
class Client {
 public:
  Client() noexcept;

  void setTimeout(std::uint32_t milliseconds) noexcept;
  // False when the path does not fit a socket address or is empty. Null: the place compiled in.
  bool setSocket(const char* path) noexcept;

  std::int32_t connect() noexcept;
  void disconnect() noexcept;
  int systemError() const noexcept { return systemError_; }

  // Sends the message, whose header it completes, with the bytes of its out-of-line descriptors, and waits
  // for the reply. `regions` are in the order of the descriptors, whose addresses and sizes it fills in.
  // On success, `reply` and its datagram stand until the next call.
  std::int32_t call(const RoutineFacts& routine, std::span<std::byte> message,
                    std::span<const std::span<const std::byte>> regions, Reply* reply) noexcept;

  // Hands the region of the last call's reply over to the caller.
  std::int32_t takeRegion(const Reply& reply, bvmh_region* region) noexcept;

 private:
  enum class Exchange : std::uint8_t {
    answered,
    notTaken,  // the peer closed without reading the request
    lost,      // the peer closed after it had read the request
    timedOut,
    broken,  // an answer, but not one of the protocol's
    failed,  // see systemError_
    noMemory,
  };

  std::int32_t checkIn(Deadline deadline) noexcept;
  std::int32_t tryCheckIn(Deadline deadline, UniqueFd* channel) noexcept;
  Exchange exchange(int socket, const RoutineFacts& routine, std::span<const iovec> parts,
                    std::span<const int> descriptors, PortName replyPort, Deadline deadline, Waiting waiting,
                    Reply* reply) noexcept;
  Exchange awaitReply(int socket, const RoutineFacts& routine, PortName replyPort, Deadline deadline,
                      Waiting waiting, Reply* reply) noexcept;
  bool isLateAnswer(PortName answered, PortName replyPort) noexcept;
  Waiting armSocketTimeout() noexcept;
  std::int32_t codeOf(Exchange outcome) const noexcept;
  void closeChannel() noexcept;
  PortName nextReplyPort() noexcept;

  sockaddr_un address_{};
  std::chrono::milliseconds timeout_;
  std::chrono::milliseconds armedTimeout_{0};  // what the channel's SO_RCVTIMEO says; 0: nothing yet
  UniqueFd deathWatch_;                        // our end; the helper watches the other one
  UniqueFd channel_;
  bool wantsChannel_ = false;  // between connect and disconnect
  PortName lastReplyPort_ = 0;
  std::uint32_t sentOnChannel_ = 0;  // requests, and so reply port numbers, of this channel
  std::uint32_t unanswered_ = 0;     // of these, requests that were given up
  int systemError_ = 0;
  Buffer buffer_;
  Incoming incoming_;
};

}  // namespace brenvik::client
