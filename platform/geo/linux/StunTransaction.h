// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <chrono>
#include <cstddef>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/geo/GeoService.h"
#include "platform/geo/linux/StunMessage.h"

namespace brenvik {

// The times, counted from the beginning, at which an unanswered request is sent; kStunPatience is when it is
// given up.
inline constexpr std::array<std::chrono::milliseconds, 5> kStunSchedule{
    std::chrono::milliseconds{0}, std::chrono::milliseconds{250}, std::chrono::milliseconds{750},
    std::chrono::milliseconds{1750}, std::chrono::milliseconds{3750}};
inline constexpr std::chrono::milliseconds kStunPatience{7750};

// The network as a transaction sees it: a few peers to send to, and a clock. One thread.
class StunNetwork {
 public:
  struct Event {
    enum class Kind { nothing, datagram, peerFailed, stopped };
    Kind kind = Kind::nothing;  // nothing: the time has passed
    std::size_t peer = 0;
    std::vector<std::byte> bytes;
  };

  virtual ~StunNetwork() = default;
  // Time since the transaction began.
  virtual std::chrono::nanoseconds elapsed() = 0;
  // Finds the server's addresses, the preferred one first, and returns their number. Takes no longer than
  // `until`.
  virtual std::size_t findPeers(std::chrono::nanoseconds until) = 0;
  // Returns false if the peer cannot be reached.
  virtual bool send(std::size_t peer, std::span<const std::byte> datagram) = 0;
  // Waits for a datagram or a failure of any peer that has not failed yet.
  virtual Event wait(std::chrono::nanoseconds until) = 0;
};

// Asks the server for the address it sees. The preferred peer is asked first; the others from the second
// sending on, or at once if the preferred one fails. Datagrams that do not answer the request are ignored and
// logged once. Only a server's answer is ever taken as the address.
struct StunOutcome {
  std::optional<std::string> address;
  std::optional<GeoError> error;
};
StunOutcome runStunTransaction(StunNetwork& network, const StunTransactionId& id);

}  // namespace brenvik
