// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/labeler/linux/Badges.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

namespace brenvik {
namespace {

std::string character(char32_t c) {
  const auto tail = [](char32_t bits) { return static_cast<char>(0x80 | (bits & 0x3F)); };
  if (c < 0x80) return {static_cast<char>(c)};
  if (c < 0x800) return {static_cast<char>(0xC0 | c >> 6), tail(c)};
  return {static_cast<char>(0xE0 | c >> 12), tail(c >> 6), tail(c)};
}

std::string badgeOf(const std::string& label) { return Badges("en").make(label).value_or("(none)"); }

// A script whose virama joins consonants, by Indic_Conjunct_Break in Unicode's DerivedCoreProperties.txt.
// Without the letters whose capitals are two characters, a letter and a nukta.
struct Script {
  char32_t virama;
  std::vector<std::pair<char32_t, char32_t>> consonants;  // from, to
  std::vector<char32_t> others;                           // beside them in the table
};

const Script kScripts[] = {
    {0x094D, {{0x0915, 0x0939}, {0x0978, 0x097F}}, {0x0914, 0x093D, 0x0960, 0x0977}},
    {0x09CD,
     {{0x0995, 0x09A8}, {0x09AA, 0x09B0}, {0x09B2, 0x09B2}, {0x09B6, 0x09B9}, {0x09F0, 0x09F1}},
     {0x0994, 0x09BD, 0x09E0, 0x09EF, 0x09F2}},
    {0x0ACD,
     {{0x0A95, 0x0AA8}, {0x0AAA, 0x0AB0}, {0x0AB2, 0x0AB3}, {0x0AB5, 0x0AB9}, {0x0AF9, 0x0AF9}},
     {0x0A94, 0x0ABD, 0x0AF1}},
    {0x0B4D,
     {{0x0B15, 0x0B28},
      {0x0B2A, 0x0B30},
      {0x0B32, 0x0B33},
      {0x0B35, 0x0B39},
      {0x0B5F, 0x0B5F},
      {0x0B71, 0x0B71}},
     {0x0B14, 0x0B3D, 0x0B60, 0x0B70, 0x0B72}},
    {0x0C4D, {{0x0C15, 0x0C28}, {0x0C2A, 0x0C39}, {0x0C58, 0x0C5A}}, {0x0C14, 0x0C3D, 0x0C60}},
    {0x0D4D, {{0x0D15, 0x0D3A}}, {0x0D14, 0x0D3D}},
};

TEST(BadgesTest, ConsonantsAroundAViramaAreOneLetterAndNothingElseIs) {
  for (const Script& script : kScripts) {
    const std::string virama = character(script.virama);
    const std::string ka = character(script.consonants.front().first);
    for (const auto& [from, to] : script.consonants) {
      for (char32_t c = from; c <= to; ++c) {
        EXPECT_EQ(badgeOf(character(c) + virama + ka), character(c) + virama + ka)
            << std::hex << std::uint32_t{c};
        EXPECT_EQ(badgeOf(ka + virama + character(c)), ka + virama + character(c))
            << std::hex << std::uint32_t{c};
      }
    }
    for (const char32_t c : script.others) {
      EXPECT_EQ(badgeOf(character(c) + virama + ka), character(c) + virama) << std::hex << std::uint32_t{c};
      EXPECT_EQ(badgeOf(ka + virama + character(c)), ka + virama) << std::hex << std::uint32_t{c};
    }
  }
}

TEST(BadgesTest, WhatStandsBetweenAViramaAndItsConsonantEndsTheConjunctUnlessItIsAMark) {
  const std::string ka = character(0x0915);
  const std::string virama = character(0x094D);
  const std::string nukta = character(0x093C);
  const std::string joiner = character(0x200D);
  EXPECT_EQ(badgeOf(ka + nukta + virama + ka), ka + nukta + virama + ka);
  EXPECT_EQ(badgeOf(ka + virama + joiner + ka), ka + virama + joiner + ka);
  EXPECT_EQ(badgeOf(ka + character(0x093E) + virama + ka), ka + character(0x093E) + virama) << "a vowel sign";
}

TEST(BadgesTest, WhatNobodySeesIsNoBadge) {
  const std::string visible = "b";
  for (const char32_t c :
       {0x20U, 0x7FU, 0x80U, 0x9FU, 0xA0U, 0xADU, 0x200BU, 0x2028U, 0xFDD0U, 0xFDEFU, 0xFFFEU, 0xFFFFU}) {
    EXPECT_EQ(badgeOf(character(c) + visible), "B") << std::hex << std::uint32_t{c};
  }
  for (const char32_t c : {0x21U, 0x7EU, 0xA1U, 0xFDCFU, 0xFDF0U, 0xFFFDU}) {
    EXPECT_EQ(badgeOf(character(c) + visible), character(c)) << std::hex << std::uint32_t{c};
  }
}

}  // namespace
}  // namespace brenvik
