// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstddef>
#include <optional>
#include <utility>
#include <vector>

namespace brenvik {

// The reasons why a server keeps running, at one moment.
struct ServerFacts {
  std::size_t clients = 0;
  // Each reason, in the order in which it was first taken, and its number of tokens.
  std::vector<std::pair<const char*, std::size_t>> busyTokens;
  // The time until the next tick of the idle timer, if it runs; 0 when the tick is due and has not come yet.
  std::optional<std::chrono::nanoseconds> leavesIn;
  bool isKeptByIdleCheck = false;  // the check's answer at the last tick
};

}  // namespace brenvik
