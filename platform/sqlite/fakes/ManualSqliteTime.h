// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

#include "platform/sqlite/SqliteTime.h"

namespace brenvik {

// Time that moves on where somebody sleeps, and by `perLook` with each look at it. It outlives what uses it.
struct ManualSqliteTime {
  std::chrono::nanoseconds now{0};
  std::chrono::nanoseconds perLook{0};
  std::chrono::nanoseconds slept{0};

  SqliteTime asTime() {
    return {[this] { return now += perLook; },
            [this](std::chrono::nanoseconds time) {
              now += time;
              slept += time;
            }};
  }
};

}  // namespace brenvik
