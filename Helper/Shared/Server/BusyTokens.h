// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

namespace brenvik {

class ServerContext;

// Takes a busy token: a mask with one bit. While any token is held, the process does not exit when idle. If
// all 32 are taken, it returns the first one (1) again. `reason` is shown in the status report; it must have
// static storage. Any thread.
std::uint32_t AcquireBusyToken(ServerContext& server, const char* reason = "unnamed-work");

// Gives a token back. Returns 1 if it is well-formed (exactly one bit set), else 0 and changes nothing.
// Giving back the last one while no client is checked in starts the idle countdown. Any thread.
std::uint32_t ReleaseBusyToken(ServerContext& server, std::uint32_t token);

}  // namespace brenvik
