// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <functional>

namespace brenvik {

// Time, as the limits on databases see it. Tests put their own here.
struct SqliteTime {
  std::function<std::chrono::nanoseconds()> now;  // since any moment, never going back
  std::function<void(std::chrono::nanoseconds)> sleepFor;
  static SqliteTime ofTheSystem();
};

}  // namespace brenvik
