// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <exception>

namespace brenvik {

// For functions whose status says that memory did not suffice: returns what `work` returns, or `onFailure`
// when it throws std::bad_alloc, or std::system_error where the system lacks a thread or a lock.
template <typename Result, typename Work>
Result guarded(Result onFailure, Work&& work) noexcept {
  try {
    return work();
  } catch (const std::exception&) {
    return onFailure;
  }
}

}  // namespace brenvik
