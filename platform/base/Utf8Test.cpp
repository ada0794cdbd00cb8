// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/Utf8.h"

#include <gtest/gtest.h>

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
