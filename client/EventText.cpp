// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/EventText.h"

#include <cstring>
#include <new>

#include "platform/base/Utf8.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik::client {
namespace {

constexpr std::string_view kBinaryMagic = "bplist00";

// The longest beginning of whole characters that leaves room for a NUL.
std::string_view cutToFit(std::string_view text, std::size_t capacity) noexcept {
  std::size_t end = 0;
  for (;;) {
    const std::size_t length = utf8CharacterLength(text.substr(end));
    if (length == 0 || end + length >= capacity) return text.substr(0, end);
    end += length;
  }
}

}  // namespace

std::ptrdiff_t textOfBinaryDictionary(std::span<const std::byte> document, std::string_view key,
                                      std::span<char> buffer) noexcept try {
  if (!buffer.empty()) buffer[0] = '\0';
  if (document.size() < kBinaryMagic.size() ||
      std::memcmp(document.data(), kBinaryMagic.data(), kBinaryMagic.size()) != 0) {
    return -1;
  }
  const PropertyList value = parsePropertyList(document).find(key);
  const auto text = value.asString();
  if (!text) return -1;
  if (!buffer.empty()) {
    const std::string_view shown = cutToFit(*text, buffer.size());
    std::memcpy(buffer.data(), shown.data(), shown.size());
    buffer[shown.size()] = '\0';
  }
  return static_cast<std::ptrdiff_t>(text->size());
} catch (const std::bad_alloc&) {
  return -1;
}

}  // namespace brenvik::client
