// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/Base64.h"

#include <array>
#include <cstdint>
#include <cstring>

namespace brenvik {
namespace {

constexpr std::string_view kDigits = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

// The two characters for each twelve bits.
constexpr std::array<std::array<char, 2>, 4096> kPairs = [] {
  std::array<std::array<char, 2>, 4096> pairs{};
  for (std::size_t i = 0; i < pairs.size(); ++i) pairs[i] = {kDigits[i >> 6], kDigits[i & 63]};
  return pairs;
}();

// What a character means: a digit's value, or one of these.
constexpr std::uint8_t kSpace = 64;
constexpr std::uint8_t kPadding = 65;
constexpr std::uint8_t kBad = 66;
constexpr std::array<std::uint8_t, 256> kValues = [] {
  std::array<std::uint8_t, 256> values{};
  values.fill(kBad);
  for (std::size_t i = 0; i < kDigits.size(); ++i) {
    values[static_cast<unsigned char>(kDigits[i])] = static_cast<std::uint8_t>(i);
  }
  for (const char c : {' ', '\t', '\n', '\r'}) values[static_cast<unsigned char>(c)] = kSpace;
  values['='] = kPadding;
  return values;
}();

char* putGroup(std::uint32_t group, char* to) noexcept {
  to[0] = static_cast<char>(group >> 16);
  to[1] = static_cast<char>(group >> 8);
  to[2] = static_cast<char>(group);
  return to + 3;
}

// Decodes groups of four digits up to the first group with anything else in it.
char* decodeGroups(const unsigned char*& from, const unsigned char* end, char* to) noexcept {
  while (end - from >= 4) {
    const std::uint32_t a = kValues[from[0]];
    const std::uint32_t b = kValues[from[1]];
    const std::uint32_t c = kValues[from[2]];
    const std::uint32_t d = kValues[from[3]];
    if ((a | b | c | d) >= kSpace) break;
    to = putGroup(a << 18 | b << 12 | c << 6 | d, to);
    from += 4;
  }
  return to;
}

// Writes the one or two bytes of a last group that was padded to four characters.
char* putRest(std::uint32_t group, int digits, char* to) noexcept {
  if (digits == 2) {
    *to++ = static_cast<char>(group >> 4);
  } else {
    *to++ = static_cast<char>(group >> 10);
    *to++ = static_cast<char>(group >> 2);
  }
  return to;
}

}  // namespace

char* encodeBase64(const char* bytes, std::size_t size, char* to) noexcept {
  const auto* from = reinterpret_cast<const unsigned char*>(bytes);
  for (; size >= 3; size -= 3, from += 3) {
    const std::uint32_t group = std::uint32_t{from[0]} << 16 | std::uint32_t{from[1]} << 8 | from[2];
    std::memcpy(to, kPairs[group >> 12].data(), 2);
    std::memcpy(to + 2, kPairs[group & 0xFFF].data(), 2);
    to += 4;
  }
  if (size == 0) return to;
  const std::uint32_t group = std::uint32_t{from[0]} << 16 | (size == 2 ? std::uint32_t{from[1]} << 8 : 0u);
  std::memcpy(to, kPairs[group >> 12].data(), 2);
  to[2] = size == 2 ? kDigits[group >> 6 & 63] : '=';
  to[3] = '=';
  return to + 4;
}

char* decodeBase64(std::string_view text, char* to) noexcept {
  const auto* from = reinterpret_cast<const unsigned char*>(text.data());
  const auto* const end = from + text.size();
  std::uint32_t group = 0;
  int held = 0;  // digits in the group
  int padding = 0;
  while (from != end) {
    if (held == 0 && padding == 0) to = decodeGroups(from, end, to);
    if (from == end) break;
    const std::uint32_t value = kValues[*from++];
    if (value == kSpace) continue;
    if (value == kPadding) {
      // One or two, where they complete a group.
      if (held + padding < 2 || ++padding + held > 4) return nullptr;
      continue;
    }
    if (value == kBad || padding != 0) return nullptr;
    group = group << 6 | value;
    if (++held < 4) continue;
    to = putGroup(group, to);
    held = 0;
  }
  if (held == 0) return padding == 0 ? to : nullptr;
  return held != 1 && held + padding == 4 ? putRest(group, held, to) : nullptr;
}

}  // namespace brenvik
