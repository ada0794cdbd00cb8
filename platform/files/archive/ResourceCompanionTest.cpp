// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/archive/ResourceCompanion.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

namespace brenvik {
namespace {

using Attributes = std::vector<std::pair<std::string, std::string>>;

std::string be(std::uint32_t value, int width) {
  std::string bytes;
  for (int i = width - 1; i >= 0; --i) bytes += static_cast<char>(value >> (8 * i) & 0xFF);
  return bytes;
}

constexpr std::uint32_t kMagic = 0x00051607;
constexpr std::uint32_t kAttributes = 9;
constexpr std::uint32_t kResourceFork = 2;

struct Entry {
  std::uint32_t id, offset, length;
};

// The companion's head: magic, version, filler, and where its entries lie.
std::string headWith(const std::vector<Entry>& entries, std::uint32_t magic = kMagic) {
  std::string head = be(magic, 4) + be(0x00020000, 4) + std::string(16, '\xEE') +
                     be(static_cast<std::uint32_t>(entries.size()), 2);
  for (const Entry& each : entries) head += be(each.id, 4) + be(each.offset, 4) + be(each.length, 4);
  return head;
}

// Names and values; the values stand behind all heads, and are told by their place in the whole companion.
// `offset`: where the entry begins there. `count`: as it says it has, if not the true number.
std::string blockAt(std::uint32_t offset, const Attributes& attributes, int count = -1) {
  std::string heads;
  std::string values;
  std::size_t size = 0;
  for (const auto& [name, value] : attributes) size += (11 + name.size() + 1 + 3) & ~std::size_t{3};
  const std::size_t valuesAt = offset + 70 + size;
  for (const auto& [name, value] : attributes) {
    heads += be(static_cast<std::uint32_t>(valuesAt + values.size()), 4) +
             be(static_cast<std::uint32_t>(value.size()), 4) + be(0, 2) +
             be(static_cast<std::uint32_t>(name.size() + 1), 1) + name + '\0';
    // The next one starts at a multiple of four, in the whole companion.
    while ((offset + 70 + heads.size()) % 4 != 0) heads += '\xEE';
    values += value;
  }
  heads.resize(size, '\xEE');
  const auto said = static_cast<std::uint32_t>(count >= 0 ? count : static_cast<int>(attributes.size()));
  return std::string(34, '\xEE') + be(0x41545452, 4) + std::string(30, '\xEE') + be(said, 2) + heads + values;
}

// One entry, at 38, so that the attributes' heads begin at 108, a multiple of four.
std::string companion(const Attributes& attributes, int count = -1) {
  return headWith({{kAttributes, 38, 0}}) + blockAt(38, attributes, count);
}

TEST(ResourceCompanionTest, EachAttributeComesOutWithItsNameAndItsValue) {
  const Attributes attributes = {{"a", "1"},
                                 {"com.example.note", "value"},
                                 {"bytes", std::string("\0\xff\0", 3)},
                                 {"empty", ""},
                                 {"日本", "last"}};
  EXPECT_EQ(extendedAttributesOf(companion(attributes)), attributes);
  EXPECT_EQ(extendedAttributesOf(companion({})), Attributes{});
  EXPECT_EQ(extendedAttributesOf(""), Attributes{});
}

TEST(ResourceCompanionTest, TheEntryMayStandBehindOthersAndOnlyTheFirstOneCounts) {
  const std::string two = headWith({{kResourceFork, 3, 5}, {kAttributes, 50, 0}});
  ASSERT_EQ(two.size(), 50u);
  EXPECT_EQ(extendedAttributesOf(two + blockAt(50, {{"n", "v"}})), (Attributes{{"n", "v"}}));
  const std::string first = blockAt(50, {{"n", "v"}});
  const auto second = static_cast<std::uint32_t>(50 + first.size());
  EXPECT_EQ(extendedAttributesOf(headWith({{kAttributes, 50, 0}, {kAttributes, second, 0}}) + first +
                                 blockAt(second, {{"o", "w"}})),
            (Attributes{{"n", "v"}}));
  // Behind the count there is none.
  std::string fewer = headWith({{kResourceFork, 3, 5}, {kAttributes, 50, 0}}) + first;
  ASSERT_EQ(fewer[25], 2);
  fewer[25] = 1;
  EXPECT_EQ(extendedAttributesOf(fewer), Attributes{});
  // One that lies beyond the end is none.
  EXPECT_EQ(extendedAttributesOf(headWith({{kAttributes, 0xFFFFFFFF, 0}, {kAttributes, 50, 0}}) + first),
            (Attributes{{"n", "v"}}));
}

TEST(ResourceCompanionTest, OfACompanionThatIsCutOffAnywhereOnlyWholeAttributesComeOut) {
  const std::string all = companion({{"first", "1"}, {"second", "22"}});
  for (std::size_t length = 0; length < all.size(); ++length) {
    // A copy of its own length, so that a memory check sees what is read behind it.
    const std::vector<char> part(all.begin(), all.begin() + static_cast<std::ptrdiff_t>(length));
    const Attributes found = extendedAttributesOf({part.data(), part.size()});
    const Attributes expected = length < all.size() - 2 ? Attributes{} : Attributes{{"first", "1"}};
    EXPECT_EQ(found, expected) << length;
  }
}

TEST(ResourceCompanionTest, ANameMayEndWhereTheCompanionEnds) {
  std::string all = companion({{"none", ""}});
  all.resize(108 + 11 + 5);
  EXPECT_EQ(extendedAttributesOf(all), (Attributes{{"none", ""}}));
  all.pop_back();
  EXPECT_EQ(extendedAttributesOf(all), Attributes{});
}

TEST(ResourceCompanionTest, WithoutItsMarksItHasNone) {
  const std::string all = companion({{"n", "v"}});
  ASSERT_EQ(extendedAttributesOf(all).size(), 1u);
  for (const std::size_t mark : {0u, 1u, 2u, 3u, 38u + 34, 38u + 35, 38u + 36, 38u + 37}) {
    std::string other = all;
    other[mark] = static_cast<char>(other[mark] ^ 1);
    EXPECT_EQ(extendedAttributesOf(other), Attributes{}) << mark;
  }
  EXPECT_EQ(extendedAttributesOf(headWith({{8, 38, 0}}) + blockAt(38, {{"n", "v"}})), Attributes{});
  EXPECT_EQ(extendedAttributesOf(headWith({})), Attributes{});
}

TEST(ResourceCompanionTest, TheCountEndsTheAttributesAndSoDoesTheEnd) {
  const Attributes two = {{"first", "1"}, {"second", "2"}};
  EXPECT_EQ(extendedAttributesOf(companion(two, 1)), (Attributes{{"first", "1"}}));
  EXPECT_EQ(extendedAttributesOf(companion(two, 0)), Attributes{});
  EXPECT_EQ(extendedAttributesOf(companion(two, 60000)), two);
  Attributes many;
  for (int i = 0; i < 300; ++i) many.emplace_back("n" + std::to_string(i), "v");
  const Attributes found = extendedAttributesOf(companion(many));
  EXPECT_EQ(found, Attributes(many.begin(), many.begin() + 64));
}

TEST(ResourceCompanionTest, AnAttributeThatMakesNoSenseIsLeftOutAndTheNextIsNot) {
  const std::string longest(200, 'n');
  const Attributes given = {{"", "1"}, {longest, "2"}, {longest + "n", "3"}, {"\xff", "4"}, {"last", "5"}};
  EXPECT_EQ(extendedAttributesOf(companion(given)), (Attributes{{longest, "2"}, {"last", "5"}}));
  // A name ends at its first NUL.
  EXPECT_EQ(extendedAttributesOf(companion({{std::string("ab\0c", 4), "v"}})), (Attributes{{"ab", "v"}}));
}

TEST(ResourceCompanionTest, AValueThatLiesOutsideIsLeftOutAndTheNextAttributeIsNot) {
  const std::string all = companion({{"out", "x"}, {"in", "y"}});
  const auto size = static_cast<std::uint32_t>(all.size());
  const auto withFirstValue = [&](std::uint32_t at, std::uint32_t length) {
    std::string other = all;
    other.replace(108, 8, be(at, 4) + be(length, 4));
    return extendedAttributesOf(other);
  };
  const Attributes without = {{"in", "y"}};
  EXPECT_EQ(withFirstValue(size - 2, 2), (Attributes{{"out", "xy"}, {"in", "y"}}));
  EXPECT_EQ(withFirstValue(size - 2, 3), without);
  EXPECT_EQ(withFirstValue(size, 0), (Attributes{{"out", ""}, {"in", "y"}}));
  EXPECT_EQ(withFirstValue(size, 1), without);
  EXPECT_EQ(withFirstValue(size + 1, 0), without);
  EXPECT_EQ(withFirstValue(size + 1, 1), without);
  EXPECT_EQ(withFirstValue(0xFFFFFFFF, 2), without);
  EXPECT_EQ(withFirstValue(0, 0xFFFFFFFF), without);
}

}  // namespace
}  // namespace brenvik
