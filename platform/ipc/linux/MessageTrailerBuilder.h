// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>

#include <cstdint>
#include <optional>

#include "interface/Wire.h"

namespace brenvik {

// The trailer of a message from what the kernel attached to it, and from /proc for what the credentials do
// not say. A sender that has gone by now has pid version 0.
MessageTrailer buildTrailer(const ucred& sender, std::uint32_t sequence) noexcept;

// The trailer of a message nobody asked a trailer for: type and size only.
MessageTrailer minimalTrailer() noexcept;

// Whether the process that sent a message is the one that made the connection, where the kernel can say
// (SO_PEERPIDFD, Linux 6.5): `unsupported` where it cannot, `refused` when it names another process or one
// that has gone. `peer` is the connection's (SO_PEERCRED).
enum class PeerPin { confirmed, unsupported, refused };
PeerPin pinPeer(int connection, pid_t peer, pid_t sender) noexcept;

}  // namespace brenvik
