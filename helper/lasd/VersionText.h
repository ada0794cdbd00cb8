// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

namespace brenvik {

// Whether two versions (UTF-8) say the same: letters are compared without regard to case, each run of ASCII
// digits by its value. "2.0" is "2.00", but not "2".
bool sameVersion(std::string_view left, std::string_view right) noexcept;

}  // namespace brenvik
