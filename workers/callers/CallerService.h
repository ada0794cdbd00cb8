// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "platform/worker/WorkerChannel.h"
#include "platform/worker/linux/WorkerRights.h"

namespace brenvik {

// Answers the helper's questions on one channel, one after the other. Returns when the helper hangs up or
// sends a malformed question; then this end hangs up.
void serveCallers(std::uint32_t work, WorkerChannel channel);

// What the program keeps: CAP_SYS_PTRACE, and the system calls that serveCallers() makes. It can open no
// file.
WorkerRights callerRights();

}  // namespace brenvik
