// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/log/linux/EscapedLine.h"

#include <cstring>

#include "platform/base/Utf8.h"

namespace brenvik {
namespace {

// The code point of a well-formed character.
char32_t codePointOf(std::string_view character) noexcept {
  const auto byteAt = [character](std::size_t i) { return static_cast<unsigned char>(character[i]); };
  if (character.size() == 1) return byteAt(0);
  char32_t point = byteAt(0) & (0x7FU >> character.size());
  for (std::size_t i = 1; i < character.size(); ++i) point = point << 6 | (byteAt(i) & 0x3FU);
  return point;
}

bool isDangerous(char32_t point) noexcept {
  if (point < 0x20 || (point >= 0x7F && point < 0xA0)) return true;
  if (point == 0x61C || point == 0x200E || point == 0x200F) return true;
  return (point >= 0x2028 && point <= 0x202E) || (point >= 0x2066 && point <= 0x2069);
}

}  // namespace

EscapedLine::EscapedLine(std::string_view line) noexcept {
  while (!line.empty()) {
    const std::size_t length = utf8CharacterLength(line);
    if (length == 0) {
      escape(line.substr(0, 1));
      line.remove_prefix(1);
      continue;
    }
    const std::string_view character = line.substr(0, length);
    if (isDangerous(codePointOf(character))) {
      escape(character);
    } else {
      append(character);
    }
    line.remove_prefix(length);
  }
  text_[size_] = '\0';
}

void EscapedLine::escape(std::string_view bytes) noexcept {
  constexpr std::string_view kDigits = "0123456789abcdef";
  for (const char each : bytes) {
    const auto byte = static_cast<unsigned char>(each);
    const std::array escaped{'\\', 'x', kDigits[byte >> 4], kDigits[byte & 0xF]};
    append({escaped.data(), escaped.size()});
  }
}

// A line that is longer than any is cut, between two characters.
void EscapedLine::append(std::string_view bytes) noexcept {
  if (bytes.size() > kMaxLength - size_) return;
  std::memcpy(text_.data() + size_, bytes.data(), bytes.size());
  size_ += bytes.size();
}

}  // namespace brenvik
