// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <netdb.h>
#include <sys/socket.h>

#include <chrono>
#include <string>
#include <vector>

namespace brenvik {

struct SocketAddress {
  sockaddr_storage storage{};
  socklen_t size = 0;
};

// The host and the port of "host", "host:port", "[ipv6]" or "[ipv6]:port".
struct HostAndPort {
  std::string host;
  std::string port;
};
HostAndPort splitHostAndPort(const std::string& text, const char* defaultPort);

// UDP addresses of a host, in the order of RFC 6724; empty when there are none, when the name servers need
// longer than `patience`, or when `stopFd` becomes readable. The C library's look-up cannot be called off, so
// it runs on a thread of its own that is left behind when it is late; one such thread at most, which a later
// call for the same host joins. Any thread.
std::vector<SocketAddress> resolveUdp(const HostAndPort& server, std::chrono::milliseconds patience,
                                      int stopFd);

}  // namespace brenvik
