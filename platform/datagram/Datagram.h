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

// As many descriptors as Linux lets one datagram carry (SCM_MAX_FD).
inline constexpr std::size_t kMaxDatagramDescriptors = 253;

// For sending, which only reads.
inline iovec iovecOf(std::span<const std::byte> bytes) noexcept {
  return {const_cast<std::byte*>(bytes.data()), bytes.size()};
}

// Sends one datagram whole or not at all, and never waits or raises SIGPIPE. The descriptors stay the
// caller's. Returns 0 or an errno, among them: EAGAIN when the channel is full, EPIPE when the peer has
// closed its end, ECONNRESET when it also left messages unread, EINVAL for more than kMaxDatagramDescriptors.
int sendDatagram(int socket, std::span<const iovec> parts, std::span<const int> descriptors = {}) noexcept;

// Room for what the kernel tells beside a datagram's bytes: `Descriptors` of them, the sender's credentials,
// and a pidfd, should the peer have asked for it.
template <std::size_t Descriptors>
struct ControlRoom {
  alignas(cmsghdr) std::array<std::byte, CMSG_SPACE(Descriptors * sizeof(int)) + CMSG_SPACE(sizeof(ucred)) +
                                             CMSG_SPACE(sizeof(int))> bytes;
};

struct ReceivedDatagram {
  std::size_t length = 0;           // bytes; 0: an empty datagram, or the end of the channel
  std::size_t descriptorCount = 0;  // how many places of `descriptors` were filled
  bool areBytesCut = false;         // the datagram was longer than the room for it
  bool areDescriptorsCut = false;   // there were more than there was room for, or than this process can have
  std::optional<ucred> sender;      // where the socket asks for credentials (SO_PASSCRED)
};

// Receives one datagram by one system call, recvmsg(2) with these flags: it waits unless they hold
// MSG_DONTWAIT. Descriptors arrive close-on-exec; those that find no place in `descriptors` are closed.
// Returns 0 or an errno; on failure *received is empty.
int receiveDatagram(int socket, std::span<const iovec> parts, std::span<std::byte> control,
                    std::span<UniqueFd> descriptors, int flags, ReceivedDatagram* received) noexcept;

}  // namespace brenvik
