// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/support/Base64.h"

#include "platform/base/Base64.h"

namespace brenvik::tools {

std::string toBase64(std::span<const std::byte> bytes) {
  std::string text(base64Size(bytes.size()), '\0');
  encodeBase64(reinterpret_cast<const char*>(bytes.data()), bytes.size(), text.data());
  return text;
}

std::optional<std::vector<std::byte>> fromBase64(std::string_view text) {
  std::vector<std::byte> bytes(base64DecodedRoom(text.size()));
  auto* const begin = reinterpret_cast<char*>(bytes.data());
  const char* const end = decodeBase64(text, begin);
  if (end == nullptr) return std::nullopt;
  bytes.resize(static_cast<std::size_t>(end - begin));
  return bytes;
}

}  // namespace brenvik::tools
