// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

namespace brenvik {

// The time since the system started, sleep included: the clock of the run loop's timers. It is never set. Any
// thread; no system call.
std::chrono::nanoseconds timeSinceBoot() noexcept;

}  // namespace brenvik
