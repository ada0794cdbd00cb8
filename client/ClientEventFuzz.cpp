// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <array>
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "client/EventText.h"

// Payloads of any bytes, looked through for a key, into buffers too small and large enough.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using brenvik::client::textOfBinaryDictionary;
  const auto document = std::as_bytes(std::span(data, size));
  std::array<char, 64> buffer{};
  for (const char* key : {"Address", "A", ""}) {
    for (const std::size_t capacity : {std::size_t{0}, std::size_t{1}, std::size_t{5}, buffer.size()}) {
      buffer.fill('?');
      const std::ptrdiff_t length = textOfBinaryDictionary(document, key, std::span(buffer).first(capacity));
      if (length < -1 || (length >= 0 && static_cast<std::size_t>(length) > 3 * size)) std::abort();
      if (capacity == 0) continue;
      const void* end = std::memchr(buffer.data(), '\0', capacity);
      if (end == nullptr) std::abort();
      if (length < 0 && buffer[0] != '\0') std::abort();
    }
  }
  return 0;
}
