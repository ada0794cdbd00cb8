// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstdint>

// Internal to this folder: dates as XML says them, which is to the second and in the years 1 to 9999.
namespace brenvik::plist {

inline constexpr std::chrono::sys_days kDayZero = std::chrono::year{2001} / 1 / 1;

constexpr std::int64_t secondsSinceDayZero(std::chrono::sys_days day) noexcept {
  return std::chrono::seconds(day - kDayZero).count();
}

inline constexpr std::int64_t kFirstSecond = secondsSinceDayZero(std::chrono::year{1} / 1 / 1);
inline constexpr std::int64_t kSecondAfterLast = secondsSinceDayZero(std::chrono::year{10000} / 1 / 1);

}  // namespace brenvik::plist
