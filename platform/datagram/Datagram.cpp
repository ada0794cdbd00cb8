// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/datagram/Datagram.h"

#include <cerrno>
#include <cstring>
#include <utility>

namespace brenvik {
namespace {

// SCM_PIDFD of Linux 6.5, which the C library's headers do not name yet. It comes only when the peer had set
// its wish on the socket before we got it; nobody here wants the descriptor, and it must not stay open.
constexpr int kScmPidfd = 4;

void takeDescriptors(const cmsghdr& item, std::span<UniqueFd> descriptors,
                     ReceivedDatagram* received) noexcept {
  const std::size_t bytes = item.cmsg_len - CMSG_LEN(0);
  for (std::size_t at = 0; at + sizeof(int) <= bytes; at += sizeof(int)) {
    int number = -1;
    std::memcpy(&number, CMSG_DATA(&item) + at, sizeof number);
    UniqueFd descriptor(number);
    if (item.cmsg_type != SCM_RIGHTS) continue;
    if (received->descriptorCount == descriptors.size()) {
      received->areDescriptorsCut = true;
      continue;
    }
    descriptors[received->descriptorCount++] = std::move(descriptor);
  }
}

}  // namespace

int sendDatagram(int socket, std::span<const iovec> parts, std::span<const int> descriptors) noexcept {
  constexpr int kFlags = MSG_DONTWAIT | MSG_NOSIGNAL;
  if (descriptors.size() > kMaxDatagramDescriptors) return EINVAL;
  msghdr message{};
  message.msg_iov = const_cast<iovec*>(parts.data());  // sendmsg only reads them
  message.msg_iovlen = parts.size();
  alignas(cmsghdr) std::array<std::byte, CMSG_SPACE(kMaxDatagramDescriptors * sizeof(int))> control;
  if (!descriptors.empty()) {
    const std::size_t room = CMSG_SPACE(descriptors.size_bytes());
    std::memset(control.data(), 0, room);
    message.msg_control = control.data();
    message.msg_controllen = room;
    cmsghdr* const item = CMSG_FIRSTHDR(&message);
    item->cmsg_level = SOL_SOCKET;
    item->cmsg_type = SCM_RIGHTS;
    item->cmsg_len = CMSG_LEN(descriptors.size_bytes());
    std::memcpy(CMSG_DATA(item), descriptors.data(), descriptors.size_bytes());
  }
  // What is one piece and nothing else goes out by send(2): the kernel need not read a msghdr.
  const bool isPlain = parts.size() == 1 && descriptors.empty();
  for (;;) {
    const ssize_t sent = isPlain ? ::send(socket, parts[0].iov_base, parts[0].iov_len, kFlags)
                                 : ::sendmsg(socket, &message, kFlags);
    if (sent >= 0) return 0;
    if (errno != EINTR) return errno;
  }
}

int receiveDatagram(int socket, std::span<const iovec> parts, std::span<std::byte> control,
                    std::span<UniqueFd> descriptors, int flags, ReceivedDatagram* received) noexcept {
  *received = ReceivedDatagram{};
  msghdr message{};
  message.msg_iov = const_cast<iovec*>(parts.data());  // the kernel writes where they point, not to them
  message.msg_iovlen = parts.size();
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  const ssize_t length = ::recvmsg(socket, &message, flags | MSG_CMSG_CLOEXEC);
  if (length < 0) return errno;
  received->length = static_cast<std::size_t>(length);
  received->areBytesCut = (message.msg_flags & MSG_TRUNC) != 0;
  received->areDescriptorsCut = (message.msg_flags & MSG_CTRUNC) != 0;
  for (cmsghdr* item = CMSG_FIRSTHDR(&message); item != nullptr; item = CMSG_NXTHDR(&message, item)) {
    if (item->cmsg_level != SOL_SOCKET) continue;
    if (item->cmsg_type == SCM_CREDENTIALS) {
      std::memcpy(&received->sender.emplace(), CMSG_DATA(item), sizeof(ucred));
    } else if (item->cmsg_type == SCM_RIGHTS || item->cmsg_type == kScmPidfd) {
      takeDescriptors(*item, descriptors, received);
    }
  }
  return 0;
}

}  // namespace brenvik
