// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/Utf8.h"

#include <gtest/gtest.h>

#include <set>
#include <string>

namespace brenvik {
namespace {

TEST(Utf8Test, AcceptsEveryLengthOfSequenceAtAnyPlace) {
  for (const char* text : {"", "a", "\xC3\xA9", "\xE2\x82\xAC", "\xF0\x9F\x98\x80", "\xEF\xBF\xBF"}) {
    for (std::string_view lead : {"", "1234567", "12345678", "123456789"}) {
      EXPECT_TRUE(isValidUtf8(std::string(lead) + text + "tail")) << lead << text;
    }
  }
}

TEST(Utf8Test, RefusesOverlongFormsSurrogatesAndCodePointsBeyondUnicode) {
  for (const char* text : {"\xC0\x80", "\xC1\xBF", "\xE0\x9F\xBF", "\xED\xA0\x80", "\xED\xBF\xBF",
                           "\xF0\x8F\xBF\xBF", "\xF4\x90\x80\x80", "\xF5\x80\x80\x80", "\xFF", "\x80"}) {
    EXPECT_FALSE(isValidUtf8(text));
    EXPECT_FALSE(isValidUtf8(std::string("12345678") + text + "abc"));
  }
}

// By RFC 3629, section 3.
std::string encoded(unsigned point) {
  const auto tail = [](unsigned bits) { return static_cast<char>(0x80 | (bits & 0x3F)); };
  if (point < 0x80) return {static_cast<char>(point)};
  if (point < 0x800) return {static_cast<char>(0xC0 | point >> 6), tail(point)};
  if (point < 0x10000) return {static_cast<char>(0xE0 | point >> 12), tail(point >> 6), tail(point)};
  return {static_cast<char>(0xF0 | point >> 18), tail(point >> 12), tail(point >> 6), tail(point)};
}

TEST(Utf8Test, EveryCodePointAndNoOtherBeginningIsACharacter) {
  std::set<std::string> beginnings;  // of two bytes
  for (unsigned point = 0x80; point <= 0x10FFFF; ++point) {
    if (point >= 0xD800 && point <= 0xDFFF) continue;  // surrogates
    const std::string character = encoded(point);
    ASSERT_EQ(utf8CharacterLength(character), character.size()) << point;
    if ((point & 0x3F) == 0) beginnings.insert(character.substr(0, 2));
  }
  for (unsigned lead = 0x80; lead <= 0xFF; ++lead) {
    for (unsigned second = 0; second <= 0xFF; ++second) {
      const std::string beginning{static_cast<char>(lead), static_cast<char>(second)};
      const bool isOne =
          lead < 0xE0 ? second >= 0x80 && second <= 0xBF && lead >= 0xC2 : beginnings.contains(beginning);
      EXPECT_EQ(utf8CharacterLength(beginning + "\x80\x80") != 0, isOne) << lead << ' ' << second;
    }
  }
}

TEST(Utf8Test, RefusesASequenceCutOffByTheEnd) {
  const std::string whole = "\xF0\x9F\x98\x80";
  for (std::size_t length = 1; length < whole.size(); ++length) {
    EXPECT_FALSE(isValidUtf8(whole.substr(0, length)));
  }
}

TEST(Utf8Test, TheFirstCharactersLengthIsToldWhateverFollowsIt) {
  EXPECT_EQ(utf8CharacterLength(""), 0U);
  EXPECT_EQ(utf8CharacterLength(std::string_view("\0", 1)), 1U);
  EXPECT_EQ(utf8CharacterLength("a\xFF"), 1U);
  EXPECT_EQ(utf8CharacterLength("\xC3\xA9\xFF"), 2U);
  EXPECT_EQ(utf8CharacterLength("\xE2\x82\xAC\xFF"), 3U);
  EXPECT_EQ(utf8CharacterLength("\xF0\x9F\x98\x80\xFF"), 4U);
  EXPECT_EQ(utf8CharacterLength("\xF0\x9F\x98"), 0U);
  EXPECT_EQ(utf8CharacterLength("\xA9"), 0U);
}

TEST(Utf8Test, AFieldEndsAtItsFirstNulOrAtItsLastByte) {
  const char field[4] = {'a', 'b', 'c', 'd'};
  EXPECT_EQ(textOfField(field, 4), "abcd");
  EXPECT_EQ(textOfField("a\0b", 3), "a");
}

}  // namespace
}  // namespace brenvik
