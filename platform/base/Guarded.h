// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <exception>

namespace brenvik {

// For functions that report "out of memory" as a status. Returns the result of `work`, or `onFailure` if
// `work` throws std::bad_alloc, or std::system_error because the system has no thread or lock to give.
template <typename Result, typename Work>
Result guarded(Result onFailure, Work&& work) noexcept {
  try {
    return work();
  } catch (const std::exception&) {
    return onFailure;
  }
}

}  // namespace brenvik
