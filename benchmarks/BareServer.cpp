// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// The floor that the daemon is measured against: a blocking SOCK_SEQPACKET server that looks at nothing. It
// takes the connection that waits at descriptor 3, answers its first message with the 40 bytes and the right
// of a check-in's reply, and then answers a request of 24 bytes with a full datagram and any other with 36
// bytes. It has the C library and no other.
#include <sys/socket.h>
#include <unistd.h>

#include <array>

#include "BareServer.h"

int main() {
  using namespace brenvik;
  alignas(4096) static std::array<char, kBareLargest> bytes;
  const int connection = ::accept4(3, nullptr, nullptr, SOCK_CLOEXEC);
  std::array<int, 2> ends{};
  if (connection < 0 || ::recv(connection, bytes.data(), bytes.size(), 0) <= 0 ||
      ::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends.data()) != 0) {
    return 1;
  }
  if (!sendWithDescriptor(connection, bytes.data(), kBareCheckInReply, ends[1])) return 1;
  ::close(ends[1]);
  ::close(connection);
  for (;;) {
    const ssize_t size = ::recv(ends[0], bytes.data(), bytes.size(), 0);
    if (size <= 0) return 0;
    const std::size_t answer = size == kBareLargeRequest ? bytes.size() : kBareReply;
    if (::send(ends[0], bytes.data(), answer, MSG_NOSIGNAL) < 0) return 1;
  }
}
