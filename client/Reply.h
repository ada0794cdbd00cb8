// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "client/Region.h"
#include "interface/Routines.h"

// Reads replies, and checks everything in them before it is used.
namespace brenvik::client {

struct Reply {
  KernelReturn code = kern::success;
  std::span<const std::byte> datagram;  // of a success: complete, of the size that its form has
  RegionPlace region;                   // form outOfLine
  UniqueFd port;                        // form checkIn: a SOCK_SEQPACKET socket
};

// Returns the reply port number that a message answers; nothing if the message is too short.
std::optional<PortName> answeredPort(std::span<const std::byte> datagram) noexcept;

// Checks and parses the reply to a request of that routine. Returns false if the reply is malformed. It does
// not check the NDR record, because one routine leaves it unset.
bool readReply(const RoutineFacts& routine, std::span<const std::byte> datagram, Incoming* incoming,
               Reply* reply) noexcept;

}  // namespace brenvik::client
