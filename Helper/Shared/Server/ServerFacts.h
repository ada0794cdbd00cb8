// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstddef>
#include <optional>
#include <utility>
#include <vector>

namespace brenvik {

// What keeps a server, at this moment.
struct ServerFacts {
  std::size_t clients = 0;
  // By reason, in the order in which they were taken; how many.
  std::vector<std::pair<const char*, std::size_t>> busyTokens;
  // Until the next tick of the idle timer, when it runs; 0 when the tick is due and has not come yet.
  std::optional<std::chrono::nanoseconds> leavesIn;
  bool isKeptByIdleCheck = false;  // as it answered at the last tick
};

}  // namespace brenvik
