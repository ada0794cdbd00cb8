// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "platform/net/EchoNetwork.h"

namespace brenvik {

// The kernel's ICMP sockets: a datagram socket, see icmp(7), else a raw one, see raw(7).
class SystemEchoNetwork final : public EchoNetwork {
 public:
  std::optional<in_addr> addressOfHost(const char* name) noexcept override;
  std::optional<int> protocolByName(const char* name) noexcept override;
  std::unique_ptr<EchoSocket> openEchoSocket(int protocol, std::uint16_t identifier) noexcept override;
  unsigned indexOfInterface(const char* name) noexcept override;
  int timeOfDay(timeval* now) noexcept override;
  std::chrono::microseconds steadyTime() noexcept override;
};

}  // namespace brenvik
