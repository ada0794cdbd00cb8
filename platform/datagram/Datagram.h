// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>
#include <sys/uio.h>

#include <array>
#include <cstddef>
#include <optional>
#include <span>

#include "platform/base/UniqueFd.h"

// Datagrams of local SOCK_SEQPACKET sockets, and the descriptors that travel with them. Nothing here throws
// or allocates. Any thread.
namespace brenvik {

// The most descriptors that Linux lets one datagram carry (SCM_MAX_FD).
inline constexpr std::size_t kMaxDatagramDescriptors = 253;

// An iovec for sending; the kernel only reads the bytes.
inline iovec iovecOf(std::span<const std::byte> bytes) noexcept {
  return {const_cast<std::byte*>(bytes.data()), bytes.size()};
}

// Sends one datagram, whole or not at all, without waiting and without SIGPIPE. The caller still owns the
// descriptors. Returns 0 or an errno, among them EAGAIN if the channel is full, EPIPE if the peer has closed
// its end, ECONNRESET if it also left messages unread, EINVAL for more than kMaxDatagramDescriptors.
int sendDatagram(int socket, std::span<const iovec> parts, std::span<const int> descriptors = {}) noexcept;

// Room for the control data of a datagram, in bytes: this many descriptors, the sender's credentials, and a
// pidfd, in case the socket asks for one.
template <std::size_t Descriptors>
struct ControlRoom {
  alignas(cmsghdr) std::array<std::byte, CMSG_SPACE(Descriptors * sizeof(int)) + CMSG_SPACE(sizeof(ucred)) +
                                             CMSG_SPACE(sizeof(int))> bytes;
};

struct ReceivedDatagram {
  std::size_t length = 0;           // bytes; 0: an empty datagram, or the end of the channel
  std::size_t descriptorCount = 0;  // how many places of `descriptors` were filled
  bool areBytesCut = false;         // the datagram was longer than the room for it
  bool areDescriptorsCut = false;   // there were more than the room, or this process's limit, allows
  std::optional<ucred> sender;      // where the socket asks for credentials (SO_PASSCRED)
};

// Receives one datagram with one recvmsg(2). It waits unless the flags have MSG_DONTWAIT. Descriptors arrive
// close-on-exec; those that do not fit into `descriptors` are closed.
// Returns 0 or an errno; on failure *received is empty.
int receiveDatagram(int socket, std::span<const iovec> parts, std::span<std::byte> control,
                    std::span<UniqueFd> descriptors, int flags, ReceivedDatagram* received) noexcept;

}  // namespace brenvik
