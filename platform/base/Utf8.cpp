// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/Utf8.h"

#include <cstdint>
#include <cstring>

namespace brenvik {

std::size_t utf8CharacterLength(std::string_view bytes) noexcept {
  if (bytes.empty()) return 0;
  const auto byteAt = [bytes](std::size_t i) { return static_cast<unsigned char>(bytes[i]); };
  const unsigned char lead = byteAt(0);
  if (lead < 0x80) return 1;
  std::size_t length = 0;
  // The second byte's range depends on the lead: this refuses overlong forms, surrogates and > U+10FFFF.
  unsigned char low = 0x80;
  unsigned char high = 0xBF;
  if (lead >= 0xC2 && lead <= 0xDF) {
    length = 2;
  } else if (lead >= 0xE0 && lead <= 0xEF) {
    length = 3;
    if (lead == 0xE0) low = 0xA0;
    if (lead == 0xED) high = 0x9F;
  } else if (lead >= 0xF0 && lead <= 0xF4) {
    length = 4;
    if (lead == 0xF0) low = 0x90;
    if (lead == 0xF4) high = 0x8F;
  } else {
    return 0;
  }
  if (bytes.size() < length || byteAt(1) < low || byteAt(1) > high) return 0;
  for (std::size_t i = 2; i < length; ++i) {
    if ((byteAt(i) & 0xC0) != 0x80) return 0;
  }
  return length;
}

bool isValidUtf8(std::string_view bytes) noexcept {
  while (!bytes.empty()) {
    // Eight ASCII bytes at a time: nearly all of what arrives here is ASCII.
    while (bytes.size() >= 8) {
      std::uint64_t word;
      std::memcpy(&word, bytes.data(), sizeof word);
      if ((word & 0x8080808080808080ULL) != 0) break;
      bytes.remove_prefix(8);
    }
    if (bytes.empty()) break;
    const std::size_t length = utf8CharacterLength(bytes);
    if (length == 0) return false;
    bytes.remove_prefix(length);
  }
  return true;
}

std::string_view textOfField(const char* field, std::size_t size) noexcept {
  return {field, ::strnlen(field, size)};
}

}  // namespace brenvik
