// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstring>

namespace brenvik {

// Whether dlopen(3) has failed for want of memory, so that the next attempt may succeed, and not because the
// library is missing or cannot be used. The C library says so in words only, of dlerror(3): with the text of
// ENOMEM, or with one of its own.
inline bool tellsLackOfMemory(const char* told) noexcept {
  return told != nullptr && std::strstr(told, "memory") != nullptr;
}

}  // namespace brenvik
