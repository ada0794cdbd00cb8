// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>

#include <cstdint>
#include <optional>

#include "interface/Wire.h"

namespace brenvik {

// Builds the trailer of a message from the credentials that the kernel attached, and from /proc for the rest.
// A sender that has already exited gets pid version 0.
MessageTrailer buildTrailer(const ucred& sender, std::uint32_t sequence) noexcept;

// The trailer for a routine that needs none: type and size only.
MessageTrailer minimalTrailer() noexcept;

// Whether the process that sent a message is the one that made the connection. `unsupported` if the kernel
// cannot tell (it needs SO_PEERPIDFD, Linux 6.5); `refused` if the connection's process is another one or has
// exited. `peer` has the connection's credentials (SO_PEERCRED).
enum class PeerPin { confirmed, unsupported, refused };
PeerPin pinPeer(int connection, pid_t peer, pid_t sender) noexcept;

}  // namespace brenvik
