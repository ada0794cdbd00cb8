// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/support/Base64.h"

#include <algorithm>
#include <cstdint>

namespace brenvik::tools {
namespace {
constexpr std::string_view kAlphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
}

std::string toBase64(std::span<const std::byte> bytes) {
  std::string text;
  text.reserve((bytes.size() + 2) / 3 * 4);
  for (std::size_t i = 0; i < bytes.size(); i += 3) {
    const std::size_t count = std::min<std::size_t>(3, bytes.size() - i);
    std::uint32_t group = 0;
    for (std::size_t j = 0; j < 3; ++j) {
      group = group << 8 | (j < count ? std::to_integer<std::uint32_t>(bytes[i + j]) : 0);
    }
    for (std::size_t j = 0; j < 4; ++j) text += j <= count ? kAlphabet[group >> (18 - 6 * j) & 0x3F] : '=';
  }
  return text;
}

std::optional<std::vector<std::byte>> fromBase64(std::string_view text) {
  std::vector<std::byte> bytes;
  std::uint32_t group = 0;
  std::size_t digits = 0;
  std::size_t padding = 0;
  for (const char each : text) {
    if (each == ' ' || each == '\t' || each == '\n' || each == '\r') continue;
    if (each == '=') {
      ++padding;
      continue;
    }
    const std::size_t value = kAlphabet.find(each);
    if (value == std::string_view::npos || padding != 0) return std::nullopt;
    group = group << 6 | static_cast<std::uint32_t>(value);
    if (++digits % 4 != 0) continue;
    for (const int shift : {16, 8, 0}) bytes.push_back(static_cast<std::byte>(group >> shift & 0xFF));
    group = 0;
  }
  const std::size_t rest = digits % 4;
  if (rest == 1 || padding != (4 - rest) % 4) return std::nullopt;
  if (rest >= 2) bytes.push_back(static_cast<std::byte>(group >> (rest == 2 ? 4 : 10) & 0xFF));
  if (rest == 3) bytes.push_back(static_cast<std::byte>(group >> 2 & 0xFF));
  return bytes;
}

}  // namespace brenvik::tools
