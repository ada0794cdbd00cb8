// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/BinaryFormat.h"

#include "platform/plist/internal/Text.h"

namespace brenvik::plist {

char* putString(char* to, const char* utf8, std::size_t size) noexcept {
  if (isAscii(utf8, size)) {
    to = putHead(to, kAsciiObject, size);
    if (size != 0) std::memcpy(to, utf8, size);
    return to + size;
  }
  const auto* from = reinterpret_cast<const unsigned char*>(utf8);
  const auto* const end = from + size;
  std::size_t units = 0;
  for (const auto* at = from; at != end; ++at)
    units += std::size_t{(*at & 0xC0) != 0x80} + std::size_t{*at >= 0xF0};
  to = putHead(to, kUtf16Object, units);
  while (from != end) {
    std::uint32_t c = *from++;
    if (c >= 0xF0) {
      c = (c & 0x07) << 18 | (from[0] & 0x3Fu) << 12 | (from[1] & 0x3Fu) << 6 | (from[2] & 0x3Fu);
      from += 3;
      c -= 0x10000;
      to = putBig(to, 0xD800 | c >> 10, 2);
      c = 0xDC00 | (c & 0x3FF);
    } else if (c >= 0xE0) {
      c = (c & 0x0F) << 12 | (from[0] & 0x3Fu) << 6 | (from[1] & 0x3Fu);
      from += 2;
    } else if (c >= 0xC0) {
      c = (c & 0x1F) << 6 | (from[0] & 0x3Fu);
      ++from;
    }
    to = putBig(to, c, 2);
  }
  return to;
}

Trailer loadTrailer(const unsigned char* at) noexcept {
  return {at[6], at[7], loadBig(at + 8, 8), loadBig(at + 16, 8), loadBig(at + 24, 8)};
}

void appendTrailer(std::string& out, const Trailer& trailer) {
  char bytes[kTrailerSize] = {};
  char* to = putBig(bytes + 6, trailer.offsetWidth, 1);
  to = putBig(to, trailer.referenceWidth, 1);
  to = putBig(to, trailer.objects, 8);
  to = putBig(to, trailer.top, 8);
  putBig(to, trailer.table, 8);
  out.append(bytes, sizeof bytes);
}

}  // namespace brenvik::plist
