// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

namespace brenvik {

// True for 0 and for any number that the kernel may use as an errno.
constexpr bool isErrorNumber(std::uint32_t number) noexcept { return number < 4096; }

}  // namespace brenvik
