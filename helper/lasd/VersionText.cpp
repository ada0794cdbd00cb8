// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/lasd/VersionText.h"

#include <locale.h>
#include <wctype.h>

#include <algorithm>
#include <cstdint>
#include <mutex>

namespace brenvik {
namespace {

constexpr bool isDigit(char c) noexcept { return c >= '0' && c <= '9'; }

// Takes the run of digits off the front, without its leading zeros: as long as a value of any size.
std::string_view takeNumber(std::string_view& text) noexcept {
  const auto end = std::find_if_not(text.begin(), text.end(), isDigit);
  auto run = text.substr(0, static_cast<std::size_t>(end - text.begin()));
  text.remove_prefix(run.size());
  run.remove_prefix(std::min(run.find_first_not_of('0'), run.size()));
  return run;
}

// Takes the first character off; of text that is not UTF-8, the first byte.
std::uint32_t takeCharacter(std::string_view& text) noexcept {
  const auto byteAt = [&](std::size_t i) { return static_cast<unsigned char>(text[i]); };
  const std::uint32_t first = byteAt(0);
  const std::size_t length = first < 0xC0 ? 1 : first < 0xE0 ? 2 : first < 0xF0 ? 3 : 4;
  if (length > text.size()) {
    text.remove_prefix(1);
    return first;
  }
  std::uint32_t value = length == 1 ? first : first & (0xFFU >> (length + 1));
  for (std::size_t i = 1; i < length; ++i) value = value << 6 | (byteAt(i) & 0x3FU);
  text.remove_prefix(length);
  return value;
}

std::uint32_t withoutCase(std::uint32_t character) noexcept {
  if (character < 0x80) return character >= 'A' && character <= 'Z' ? character + ('a' - 'A') : character;
  // The process's own locale is "C", which knows no letters but ASCII's. Never freed: it serves until exit.
  // Where it cannot be had now, the next call tries again.
  static std::mutex mutex;
  static locale_t utf8 = nullptr;
  const std::lock_guard lock(mutex);
  if (utf8 == nullptr) utf8 = ::newlocale(LC_CTYPE_MASK, "C.UTF-8", nullptr);
  if (utf8 == nullptr) return character;
  return static_cast<std::uint32_t>(::towlower_l(::towupper_l(character, utf8), utf8));
}

}  // namespace

bool sameVersion(std::string_view left, std::string_view right) noexcept {
  while (!left.empty() && !right.empty()) {
    if (isDigit(left.front()) && isDigit(right.front())) {
      if (takeNumber(left) != takeNumber(right)) return false;
    } else if (withoutCase(takeCharacter(left)) != withoutCase(takeCharacter(right))) {
      return false;
    }
  }
  return left.empty() && right.empty();
}

}  // namespace brenvik
