// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <chrono>
#include <string>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/geo/linux/StunTransaction.h"

namespace brenvik {

// The real network: one connected UDP socket for each peer; the peers are the server's first address of each
// family.
class UdpStunNetwork final : public StunNetwork {
 public:
  // `server` is host:port; the default port is 3478. The transaction's time begins here. Every wait ends when
  // `stopFd` becomes readable.
  UdpStunNetwork(std::string server, int stopFd);

  std::chrono::nanoseconds elapsed() override;
  std::size_t findPeers(std::chrono::nanoseconds until) override;
  bool send(std::size_t peer, std::span<const std::byte> datagram) override;
  Event wait(std::chrono::nanoseconds until) override;

 private:
  const std::string server_;
  const int stopFd_;
  const std::chrono::steady_clock::time_point start_ = std::chrono::steady_clock::now();
  std::vector<UniqueFd> sockets_;  // closed when its peer has failed
};

}  // namespace brenvik
