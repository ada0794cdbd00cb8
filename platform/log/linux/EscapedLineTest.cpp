// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/log/linux/EscapedLine.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>

namespace brenvik {
namespace {

std::string escaped(std::string_view line) {
  const EscapedLine result(line);
  EXPECT_EQ(result.text()[result.view().size()], '\0');
  return std::string(result.view());
}

std::string utf8(char32_t point) {
  const auto byte = [](char32_t value) { return static_cast<char>(value); };
  if (point < 0x80) return {byte(point)};
  if (point < 0x800) return {byte(0xC0 | point >> 6), byte(0x80 | (point & 0x3F))};
  if (point < 0x10000) {
    return {byte(0xE0 | point >> 12), byte(0x80 | (point >> 6 & 0x3F)), byte(0x80 | (point & 0x3F))};
  }
  return {byte(0xF0 | point >> 18), byte(0x80 | (point >> 12 & 0x3F)), byte(0x80 | (point >> 6 & 0x3F)),
          byte(0x80 | (point & 0x3F))};
}

TEST(EscapedLineTest, OrdinaryTextOfAnyScriptStaysAsItIs) {
  for (const std::string_view text :
       {"", "Loading /a as plist", "caf\xC3\xA9 \\x0a \xC2\xA0", "\xD7\xA9\xD7\x9C\xD7\x95\xD7\x9D",
        "\xD8\xB3\xD9\x84\xD8\xA7\xD9\x85", "\xE6\xBC\xA2\xE5\xAD\x97",
        "\xF0\x9F\x91\xA8\xE2\x80\x8D\xF0\x9F\x91\xA9", "\xE2\x80\x93 \xE2\x80\xA6 \xEF\xBB\xBF"}) {
    EXPECT_EQ(escaped(text), text);
  }
}

TEST(EscapedLineTest, OfAllCharactersExactlyTheControlsAreEscaped) {
  const auto isControl = [](char32_t p) {
    return p <= 0x1F || (p >= 0x7F && p <= 0x9F) || p == 0x61C || p == 0x200E || p == 0x200F || p == 0x2028 ||
           p == 0x2029 || (p >= 0x202A && p <= 0x202E) || (p >= 0x2066 && p <= 0x2069);
  };
  for (char32_t point = 0; point <= 0x10FFFF; ++point) {
    if (point >= 0xD800 && point <= 0xDFFF) continue;
    const std::string character = utf8(point);
    const std::string line = "a" + character + "z";
    const std::string result = escaped(line);
    if (!isControl(point)) {
      ASSERT_EQ(result, line) << "U+" << std::hex << static_cast<std::uint32_t>(point);
    } else {
      ASSERT_EQ(result.size(), 2 + 4 * character.size())
          << "U+" << std::hex << static_cast<std::uint32_t>(point);
      ASSERT_TRUE(result.starts_with("a\\x") && result.ends_with('z'));
    }
  }
}

TEST(EscapedLineTest, AControlIsEscapedByteByByte) {
  EXPECT_EQ(escaped("a\nb\x1B[31m\x7F"), "a\\x0ab\\x1b[31m\\x7f");
  EXPECT_EQ(escaped("\xC2\x9B"), "\\xc2\\x9b");
  EXPECT_EQ(escaped("\xE2\x80\xAEgpj.exe"), "\\xe2\\x80\\xaegpj.exe");
  EXPECT_EQ(escaped("a\xE2\x80\xA8"
                    "b"),
            "a\\xe2\\x80\\xa8"
            "b");
  EXPECT_EQ(escaped(std::string_view("a\0b", 3)), "a\\x00b");
}

TEST(EscapedLineTest, BytesThatAreNoUtf8AreEscapedAndTheRestStaysReadable) {
  EXPECT_EQ(escaped("caf\xC3\xA9 \xFF \xC3"), "caf\xC3\xA9 \\xff \\xc3");
  EXPECT_EQ(escaped("\xED\xA0\x80\xC0\x80"), "\\xed\\xa0\\x80\\xc0\\x80");
  // A cut-off override must not come to life with what follows it.
  EXPECT_EQ(escaped("\xE2\x80"), "\\xe2\\x80");
}

TEST(EscapedLineTest, TheLongestLineFitsWhateverIsInIt) {
  std::string wanted;
  for (int i = 0; i < 4096; ++i) wanted += "\\x1b";
  EXPECT_EQ(escaped(std::string(4096, '\x1B')), wanted);
  EXPECT_EQ(escaped(std::string(100'000, 'x')).size(), 4U * 4096);
}

}  // namespace
}  // namespace brenvik
