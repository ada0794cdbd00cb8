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

// Returns the UDP addresses of a host, in the order of RFC 6724; none if there are none, if the name servers
// need longer than `patience`, or if `stopFd` becomes readable. The C library's look-up cannot be cancelled,
// so it runs on its own thread, which is left behind if it is late. There is at most one such thread; a later
// call for the same host waits for it. Any thread.
std::vector<SocketAddress> resolveUdp(const HostAndPort& server, std::chrono::milliseconds patience,
                                      int stopFd);

}  // namespace brenvik
