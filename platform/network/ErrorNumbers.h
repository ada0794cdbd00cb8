// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

namespace brenvik {

// 0, or a number that the kernel may give as an error.
constexpr bool isErrorNumber(std::uint32_t number) noexcept { return number < 4096; }

}  // namespace brenvik
