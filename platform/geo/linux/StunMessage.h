// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstddef>
#include <span>
#include <string>

// The two messages of a STUN binding transaction (RFC 8489), which finds the public address.
namespace brenvik {

using StunTransactionId = std::array<std::byte, 12>;
using StunRequest = std::array<std::byte, 20>;

StunRequest makeStunBindingRequest(const StunTransactionId& id) noexcept;

enum class StunVerdict {
  ignored,    // no answer to this request, a malformed one, or one that cannot be understood without knowing
              // more
  refused,    // the server says that it will not answer it
  noAddress,  // a success, without an address that a host can have
  address,
};
struct StunAnswer {
  StunVerdict verdict = StunVerdict::ignored;
  std::string address;  // IPv4 or IPv6, as inet_ntop(3) writes it
};

// Reads a datagram from the server as the answer to the request with this id. An address that no host can
// have counts as none: a family other than IPv4 and IPv6, unspecified, in 0/8, multicast or reserved.
StunAnswer readStunAnswer(std::span<const std::byte> datagram, const StunTransactionId& id);

}  // namespace brenvik
