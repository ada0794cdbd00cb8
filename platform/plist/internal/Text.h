// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>

// What both readers do with texts.
namespace brenvik::plist {

inline bool isAscii(const char* bytes, std::size_t size) noexcept {
  std::uint64_t all = 0;
  for (; size >= 8; size -= 8, bytes += 8) {
    std::uint64_t word;
    std::memcpy(&word, bytes, sizeof word);
    all |= word;
  }
  for (; size != 0; --size, ++bytes) all |= static_cast<unsigned char>(*bytes);
  return (all & 0x8080808080808080ULL) == 0;
}

enum class ByteOrder { big, little };

// Returns the end of what was written, at most three bytes a unit, or null at an unpaired surrogate.
template <ByteOrder order>
char* utf8FromUtf16(const unsigned char* from, std::size_t units, char* to) noexcept {
  constexpr std::size_t kHigh = order == ByteOrder::big ? 0 : 1;
  auto put = [&to](std::uint32_t byte) { *to++ = static_cast<char>(byte); };
  auto unit = [from](std::size_t i) {
    return std::uint32_t{from[2 * i + kHigh]} << 8 | from[2 * i + (1 - kHigh)];
  };
  for (std::size_t i = 0; i < units; ++i) {
    std::uint32_t c = unit(i);
    if (c < 0x80) {
      put(c);
      continue;
    }
    if (c < 0x800) {
      put(0xC0 | c >> 6);
      put(0x80 | (c & 0x3F));
      continue;
    }
    if (c >= 0xD800 && c <= 0xDFFF) {
      if (c >= 0xDC00 || ++i == units) return nullptr;
      const std::uint32_t low = unit(i);
      if (low < 0xDC00 || low > 0xDFFF) return nullptr;
      c = 0x10000 + ((c & 0x3FF) << 10 | (low & 0x3FF));
      put(0xF0 | c >> 18);
      put(0x80 | (c >> 12 & 0x3F));
    } else {
      put(0xE0 | c >> 12);
    }
    put(0x80 | (c >> 6 & 0x3F));
    put(0x80 | (c & 0x3F));
  }
  return to;
}

}  // namespace brenvik::plist
