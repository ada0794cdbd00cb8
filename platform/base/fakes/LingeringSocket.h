// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>

#include <vector>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// A TCP socket whose last close blocks, for an hour by default, because the peer never reads what was sent.
struct LingeringSocket {
  UniqueFd listening{::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
  UniqueFd socket{::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)};

  explicit LingeringSocket(int seconds = 3600) {
    const int small = 1;
    ::setsockopt(listening.get(), SOL_SOCKET, SO_RCVBUF, &small, sizeof small);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    auto* const raw = reinterpret_cast<sockaddr*>(&address);
    EXPECT_EQ(::bind(listening.get(), raw, size), 0);
    EXPECT_EQ(::listen(listening.get(), 1), 0);
    EXPECT_EQ(::getsockname(listening.get(), raw, &size), 0);
    (void)::connect(socket.get(), raw, size);
    pollfd connected{socket.get(), POLLOUT, 0};
    EXPECT_EQ(::poll(&connected, 1, 10'000), 1);
    const linger on{1, seconds};
    EXPECT_EQ(::setsockopt(socket.get(), SOL_SOCKET, SO_LINGER, &on, sizeof on), 0);
    const std::vector<char> block(65536);
    while (::send(socket.get(), block.data(), block.size(), MSG_DONTWAIT | MSG_NOSIGNAL) > 0) {
    }
  }
};

}  // namespace brenvik
