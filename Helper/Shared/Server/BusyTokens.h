// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

namespace brenvik {

class ServerContext;

// Takes a busy token: a mask with one bit. While any token is held the process does not leave for being idle.
// With all 32 out, the first is given again (1). `reason`: for whoever asks what keeps the process; static
// storage. Any thread.
std::uint32_t AcquireBusyToken(ServerContext& server, const char* reason = "unnamed-work");

// Gives a token back: 1 when it was well formed (exactly one bit set), else 0 and nothing changes. Giving
// back the last one while no client is checked in starts the idle countdown. Any thread.
std::uint32_t ReleaseBusyToken(ServerContext& server, std::uint32_t token);

}  // namespace brenvik
