// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <vector>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// A socket whose last close waits for two seconds: its peer takes nothing, and it is to linger.
class LingeringSocket {
 public:
  LingeringSocket() {
    const UniqueFd listening(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    auto* const where = reinterpret_cast<sockaddr*>(&address);
    EXPECT_EQ(::bind(listening.get(), where, size), 0);
    EXPECT_EQ(::listen(listening.get(), 1), 0);
    EXPECT_EQ(::getsockname(listening.get(), where, &size), 0);
    socket.reset(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    EXPECT_EQ(::connect(socket.get(), where, size), 0);
    peer.reset(::accept4(listening.get(), nullptr, nullptr, SOCK_CLOEXEC));
    const std::vector<char> much(1 << 20);
    while (::send(socket.get(), much.data(), much.size(), MSG_DONTWAIT) > 0) {
    }
    const linger on{1, 2};
    EXPECT_EQ(::setsockopt(socket.get(), SOL_SOCKET, SO_LINGER, &on, sizeof on), 0);
  }
  UniqueFd socket;
  UniqueFd peer;
};

}  // namespace brenvik
