// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

namespace brenvik {

// Since the system started, the time it slept included, as the run loop's timers count. Nobody sets this
// clock. Any thread; no system call.
std::chrono::nanoseconds timeSinceBoot() noexcept;

}  // namespace brenvik
