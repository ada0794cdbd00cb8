// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

namespace brenvik {

// The time since the system started, sleep included. The run loop's timers use this clock; nobody can set it.
// Any thread; makes no system call.
std::chrono::nanoseconds timeSinceBoot() noexcept;

}  // namespace brenvik
