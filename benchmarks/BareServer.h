// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>

#include <array>
#include <cstddef>
#include <cstring>

// What the bare server (BareServer.cpp) sends and tells apart by size, in bytes; and how both ends send the
// one message that carries a descriptor.
namespace brenvik {

inline constexpr std::size_t kBareLargest = 65536;
inline constexpr std::size_t kBareCheckInReply = 40;
inline constexpr std::size_t kBareReply = 36;
inline constexpr std::ptrdiff_t kBareLargeRequest = 24;  // answered with kBareLargest bytes

// One message with one descriptor.
inline bool sendWithDescriptor(int socket, void* bytes, std::size_t size, int descriptor) {
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof descriptor)> control{};
  iovec io{bytes, size};
  msghdr message{};
  message.msg_iov = &io;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  cmsghdr* const item = CMSG_FIRSTHDR(&message);
  item->cmsg_level = SOL_SOCKET;
  item->cmsg_type = SCM_RIGHTS;
  item->cmsg_len = CMSG_LEN(sizeof descriptor);
  std::memcpy(CMSG_DATA(item), &descriptor, sizeof descriptor);
  return ::sendmsg(socket, &message, MSG_NOSIGNAL) == static_cast<ssize_t>(size);
}

}  // namespace brenvik
