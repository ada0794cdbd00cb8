// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/Dates.h"

#include <chrono>
#include <cstdint>

namespace brenvik::plist {
namespace {

constexpr std::string_view kForm = "0000-00-00T00:00:00Z";
static_assert(kForm.size() == kDateSize);

constexpr std::chrono::sys_days kDayZero = std::chrono::year{2001} / 1 / 1;

constexpr std::int64_t secondsSinceDayZero(std::chrono::sys_days day) noexcept {
  return std::chrono::seconds(day - kDayZero).count();
}

constexpr std::int64_t kFirstSecond = secondsSinceDayZero(std::chrono::year{1} / 1 / 1);
constexpr std::int64_t kSecondAfterLast = secondsSinceDayZero(std::chrono::year{10000} / 1 / 1);

bool hasForm(std::string_view text) noexcept {
  if (text.size() != kForm.size()) return false;
  for (std::size_t i = 0; i < kForm.size(); ++i) {
    if (kForm[i] == '0' ? text[i] < '0' || text[i] > '9' : text[i] != kForm[i]) return false;
  }
  return true;
}

char* digits(char* to, std::int64_t number, int width) noexcept {
  for (int i = width - 1; i >= 0; --i, number /= 10) to[i] = static_cast<char>('0' + number % 10);
  return to + width;
}

}  // namespace

std::optional<double> parseDate(std::string_view text) noexcept {
  if (!hasForm(text)) return std::nullopt;
  auto number = [text](std::size_t at, std::size_t width) {
    int value = 0;
    for (std::size_t i = at; i < at + width; ++i) value = value * 10 + (text[i] - '0');
    return value;
  };
  const std::chrono::year_month_day day{std::chrono::year{number(0, 4)},
                                        std::chrono::month{static_cast<unsigned>(number(5, 2))},
                                        std::chrono::day{static_cast<unsigned>(number(8, 2))}};
  const int hour = number(11, 2);
  const int minute = number(14, 2);
  const int second = number(17, 2);
  if (!day.ok() || day.year() < std::chrono::year{1} || hour > 23 || minute > 59 || second > 59)
    return std::nullopt;
  return static_cast<double>(secondsSinceDayZero(day) + hour * 3600L + minute * 60L + second);
}

char* formatDate(char* to, double seconds) noexcept {
  // Not a number fails both comparisons.
  if (!(seconds >= static_cast<double>(kFirstSecond) && seconds < static_cast<double>(kSecondAfterLast)))
    return nullptr;
  auto whole = static_cast<std::int64_t>(seconds);
  if (static_cast<double>(whole) > seconds) --whole;
  const std::chrono::seconds since{whole};
  const auto day = std::chrono::floor<std::chrono::days>(since);
  const std::chrono::year_month_day date{kDayZero + day};
  const std::int64_t second = (since - day).count();
  to = digits(to, int{date.year()}, 4);
  *to++ = '-';
  to = digits(to, unsigned{date.month()}, 2);
  *to++ = '-';
  to = digits(to, unsigned{date.day()}, 2);
  *to++ = 'T';
  to = digits(to, second / 3600, 2);
  *to++ = ':';
  to = digits(to, second / 60 % 60, 2);
  *to++ = ':';
  to = digits(to, second % 60, 2);
  *to++ = 'Z';
  return to;
}

}  // namespace brenvik::plist
