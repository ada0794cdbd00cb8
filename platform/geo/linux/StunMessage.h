// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstddef>
#include <span>
#include <string>

// The two messages of a STUN binding transaction (RFC 8489) that finding one's public address takes.
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

// What a datagram from the server says to the request with this id. No host has an address of another family
// than IPv4 and IPv6, the unspecified one, one of 0/8, a multicast or a reserved one.
StunAnswer readStunAnswer(std::span<const std::byte> datagram, const StunTransactionId& id);

}  // namespace brenvik
