// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "client/Region.h"
#include "interface/Routines.h"

// Reads replies. Nothing in them is believed before it is checked.
namespace brenvik::client {

struct Reply {
  KernelReturn code = kern::success;
  std::span<const std::byte> datagram;  // of a success: complete, of the size that its form has
  RegionPlace region;                   // form outOfLine
  UniqueFd port;                        // form checkIn: a SOCK_SEQPACKET socket
};

// The reply port number that a message answers; nothing when it is too short to say.
std::optional<PortName> answeredPort(std::span<const std::byte> datagram) noexcept;

// Checks the reply to a request of that routine and takes it apart. False when any of it is not as the
// protocol says. The NDR record is not looked at: one routine leaves it unset.
bool readReply(const RoutineFacts& routine, std::span<const std::byte> datagram, Incoming* incoming,
               Reply* reply) noexcept;

}  // namespace brenvik::client
