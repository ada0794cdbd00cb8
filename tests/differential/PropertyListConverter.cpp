// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Reads property lists from standard input and answers on standard output until the input ends.
// A request: 'x' or 'b' for the format wanted, a 32-bit big-endian length, the document in any format.
// An answer: '+', the length and the document; or 'r' (not readable) or 'w' (not writable) and a length of 0.
#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>

#include "platform/plist/PropertyListCodec.h"

namespace {

bool readBytes(void* to, std::size_t size) { return std::fread(to, 1, size, stdin) == size; }

void answer(char status, const std::string& document) {
  const auto length = static_cast<std::uint32_t>(document.size());
  std::fputc(status, stdout);
  for (int shift = 24; shift >= 0; shift -= 8) std::fputc(static_cast<int>(length >> shift & 0xFF), stdout);
  std::fwrite(document.data(), 1, document.size(), stdout);
  std::fflush(stdout);
}

}  // namespace

int main() {
  unsigned char head[5];
  while (readBytes(head, sizeof head)) {
    std::uint32_t length = 0;
    for (int i = 1; i <= 4; ++i) length = length << 8 | head[i];
    std::string document(length, '\0');
    if (!readBytes(document.data(), length)) return 1;
    const brenvik::PropertyList value = brenvik::parsePropertyList(std::as_bytes(std::span(document)));
    const auto format =
        head[0] == 'x' ? brenvik::PropertyListFormat::xml : brenvik::PropertyListFormat::binary;
    const auto written = value ? brenvik::serializePropertyList(value, format) : std::optional<std::string>();
    if (written) {
      answer('+', *written);
    } else {
      answer(value ? 'w' : 'r', "");
    }
  }
  return 0;
}
