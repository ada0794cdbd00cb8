// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <optional>
#include <string_view>

// Dates as XML has them: whole seconds of UTC in the years 1 to 9999, "2001-01-01T00:00:00Z".
namespace brenvik::plist {

inline constexpr std::size_t kDateSize = 20;  // bytes of the form

// Seconds since the beginning of 2001; nothing if the text is not exactly a date.
std::optional<double> parseDate(std::string_view text) noexcept;

// Writes the kDateSize bytes of the second that has begun, and returns their end; null if the format has no
// such date.
char* formatDate(char* to, double secondsSince2001) noexcept;

}  // namespace brenvik::plist
