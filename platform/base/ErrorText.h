// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstring>

namespace brenvik {

// Describes an errno in words, for log lines. Any thread.
inline const char* describeError(int error) noexcept {
  const char* const text = ::strerrordesc_np(error);
  return text != nullptr ? text : "unknown error";
}

}  // namespace brenvik
