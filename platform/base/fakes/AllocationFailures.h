// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Which allocations of a thread fail: one thread_local object for each way to allocate. Constant-initialised
// and without a destructor, since allocations happen before and after everything else.
struct AllocationFailures {
  bool isArmed = false;
  bool failsAll = false;
  long untilFailure = 0;
  long failed = 0;

  // Lets allocation number `first` (0: the next one) fail, and with `all` every later one too.
  constexpr void arm(long first, bool all) noexcept { *this = {true, all, first, 0}; }

  // Called for each allocation; true if it must fail.
  constexpr bool takeTurn() noexcept {
    if (!isArmed || untilFailure-- > 0) return false;
    if (untilFailure != -1 && !failsAll) return false;
    ++failed;
    return true;
  }
};

}  // namespace brenvik
