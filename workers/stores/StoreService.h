// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "platform/worker/WorkerChannel.h"

namespace brenvik {

// Serves one channel of the helper with the voicemail store or the contacts. Returns when the helper hangs up
// or sends a malformed request; then this end hangs up. Call it on a thread of its own.
void serveStore(std::uint32_t work, WorkerChannel channel) noexcept;

}  // namespace brenvik
