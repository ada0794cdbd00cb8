// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

namespace brenvik {

// Whether two versions (UTF-8) are equal. Letters are compared without case, runs of ASCII digits by value:
// "2.0" equals "2.00", but not "2". Any thread.
bool sameVersion(std::string_view left, std::string_view right) noexcept;

}  // namespace brenvik
