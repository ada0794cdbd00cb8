// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/time.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>

// The heartbeat's ICMP messages (RFC 792), byte for byte.
namespace brenvik {

inline constexpr std::size_t kEchoMessageSize = 48;
using EchoMessage = std::array<std::byte, kEchoMessageSize>;

// The Internet checksum (RFC 1071) in host byte order; an odd last byte counts as if a zero byte followed.
std::uint16_t internetChecksum(std::span<const std::byte> bytes) noexcept;

// An echo request: sequence number 0, the time as the host keeps it at offset 8, zeros to the end.
EchoMessage makeEchoRequest(std::uint16_t identifier, const timeval& time) noexcept;

// True when the datagram holds an echo reply of at least kEchoMessageSize bytes to a request that carried the
// identifier; `afterIpHeader` tells whether an IPv4 header comes first.
bool isEchoReply(std::span<const std::byte> datagram, bool afterIpHeader, std::uint16_t identifier) noexcept;

}  // namespace brenvik
