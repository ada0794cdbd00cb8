// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/PropertyList.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <malloc.h>

#include <array>
#include <cmath>
#include <limits>
#include <thread>

#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

using Type = PropertyList::Type;
using Entries = std::vector<std::pair<std::string, PropertyList>>;

PropertyList parse(std::string_view text) { return parsePropertyList(std::as_bytes(std::span(text))); }

PropertyList text(std::string_view utf8) { return PropertyList::string(utf8); }

std::vector<std::string> keysOf(const PropertyList& dictionary) {
  std::vector<std::string> keys;
  for (std::size_t i = 0; i < dictionary.size(); ++i) keys.emplace_back(dictionary.keyAt(i));
  return keys;
}

TEST(PropertyListTest, IsNoValueUntilItIsMade) {
  const PropertyList none{};
  EXPECT_FALSE(none);
  EXPECT_FALSE(none.is(Type::string));
  EXPECT_EQ(none.size(), 0u);
  EXPECT_FALSE(none.at(0));
  EXPECT_FALSE(none.find("a"));
  EXPECT_EQ(none.keyAt(0), "");
  EXPECT_EQ(none, PropertyList());
  EXPECT_FALSE(none == PropertyList::boolean(false));
}

TEST(PropertyListTest, EachTypeAnswersItsOwnQuestionAndNoOther) {
  const std::array<std::byte, 2> bytes{std::byte{1}, std::byte{0}};
  const std::vector<std::pair<PropertyList, Type>> values{
      {PropertyList::boolean(true), Type::boolean}, {PropertyList::integer(-3), Type::integer},
      {PropertyList::real(0.5), Type::real},        {text("t"), Type::string},
      {PropertyList::data(bytes), Type::data},      {PropertyList::date(12.25), Type::date},
      {PropertyList::array({}), Type::array},       {PropertyList::dictionary({}), Type::dictionary}};
  for (const auto& [value, type] : values) {
    ASSERT_TRUE(value);
    EXPECT_EQ(value.type(), type);
    EXPECT_TRUE(value.is(type));
    EXPECT_EQ(value.asBoolean().has_value(), type == Type::boolean);
    EXPECT_EQ(value.asInteger().has_value(), type == Type::integer);
    EXPECT_EQ(value.asReal().has_value(), type == Type::real);
    EXPECT_EQ(value.asString().has_value(), type == Type::string);
    EXPECT_EQ(value.asData().has_value(), type == Type::data);
    EXPECT_EQ(value.asDate().has_value(), type == Type::date);
    EXPECT_EQ(value.size(), 0u);
    for (const auto& [other, otherType] : values) EXPECT_EQ(value == other, type == otherType);
  }
  EXPECT_EQ(values[0].first.asBoolean(), true);
  EXPECT_EQ(values[1].first.asInteger(), -3);
  EXPECT_EQ(values[2].first.asReal(), 0.5);
  EXPECT_EQ(values[3].first.asString(), "t");
  EXPECT_THAT(values[4].first.asData().value(), testing::ElementsAreArray(bytes));
  EXPECT_EQ(values[5].first.asDate(), 12.25);
}

TEST(PropertyListTest, IntegersKnowWhichOfTheirTwoRangesTheyFit) {
  EXPECT_EQ(PropertyList::integer(-1).asUnsignedInteger(), std::nullopt);
  EXPECT_EQ(PropertyList::integer(7).asUnsignedInteger(), 7u);
  EXPECT_EQ(PropertyList::unsignedInteger(7), PropertyList::integer(7));
  const PropertyList large = PropertyList::unsignedInteger(UINT64_MAX);
  EXPECT_TRUE(large.is(Type::integer));
  EXPECT_EQ(large.asInteger(), std::nullopt);
  EXPECT_EQ(large.asUnsignedInteger(), UINT64_MAX);
  EXPECT_FALSE(large == PropertyList::integer(-1));
  EXPECT_EQ(PropertyList::unsignedInteger(INT64_MAX).asInteger(), INT64_MAX);
}

TEST(PropertyListTest, AStringMustBeUtf8AndMayHoldNul) {
  EXPECT_FALSE(text("\xC3"));
  EXPECT_FALSE(text("\xED\xA0\x80"));
  EXPECT_EQ(text(std::string_view("a\0b", 3)).asString(), std::string_view("a\0b", 3));
  EXPECT_EQ(text("").asString(), "");
}

TEST(PropertyListTest, ADictionaryWithAKeyThatIsNotUtf8IsNoValue) {
  EXPECT_FALSE(PropertyList::dictionary({{"good", text("x")}, {"\xFF", text("y")}}));
  EXPECT_FALSE(PropertyList::dictionary({}).withEntry("\xFF", text("y")));
}

TEST(PropertyListTest, AbsentElementsAndEntriesAreLeftOut) {
  const PropertyList array = PropertyList::array({text("a"), PropertyList(), text("b")});
  ASSERT_EQ(array.size(), 2u);
  EXPECT_EQ(array.at(1).asString(), "b");
  const PropertyList dictionary = PropertyList::dictionary({{"a", PropertyList()}, {"b", text("x")}});
  EXPECT_THAT(keysOf(dictionary), testing::ElementsAre("b"));
  EXPECT_EQ(PropertyList::array({PropertyList()}), PropertyList::array({}));
}

TEST(PropertyListTest, ADictionaryKeepsTheOrderOfItsKeys) {
  const PropertyList value = PropertyList::dictionary({{"z", text("1")}, {"", text("2")}, {"a", text("3")}});
  EXPECT_THAT(keysOf(value), testing::ElementsAre("z", "", "a"));
  EXPECT_EQ(value.at(1).asString(), "2");
  EXPECT_EQ(value.find("").asString(), "2");
  EXPECT_EQ(value.find("a").asString(), "3");
  EXPECT_FALSE(value.find("b"));
  EXPECT_FALSE(value.at(3));
  EXPECT_EQ(value.keyAt(3), "");
}

TEST(PropertyListTest, OfEqualKeysTheFirstPlaceAndTheLastValueStand) {
  for (const int distinct : {1, 3, 8, 16, 17, 40, 1000}) {
    for (const int times : {2, 3}) {
      Entries entries;
      for (int i = 0; i < distinct * times; ++i) {
        entries.emplace_back("key" + std::to_string(i % distinct), PropertyList::integer(i));
      }
      const PropertyList value = PropertyList::dictionary(entries);
      ASSERT_EQ(value.size(), static_cast<std::size_t>(distinct));
      for (int i = 0; i < distinct; ++i) {
        const auto index = static_cast<std::size_t>(i);
        EXPECT_EQ(value.keyAt(index), "key" + std::to_string(i));
        EXPECT_EQ(value.at(index).asInteger(), distinct * (times - 1) + i);
        EXPECT_EQ(value.find("key" + std::to_string(i)).asInteger(), distinct * (times - 1) + i);
      }
      EXPECT_FALSE(value.find("key"));
    }
  }
}

TEST(PropertyListTest, FindsEveryKeyOfEveryLengthAndNoOther) {
  Entries entries;
  for (std::size_t length = 0; length < 70; ++length) {
    entries.emplace_back(std::string(length, 'k'), PropertyList::integer(static_cast<std::int64_t>(length)));
  }
  const PropertyList value = PropertyList::dictionary(entries);
  for (std::size_t length = 0; length < 70; ++length) {
    std::string key(length, 'k');
    EXPECT_EQ(value.find(key).asInteger(), static_cast<std::int64_t>(length));
    if (length == 0) continue;
    key.back() = 'K';
    EXPECT_FALSE(value.find(key));
    key.back() = 'k';
    key.front() = 'K';
    EXPECT_FALSE(value.find(key));
  }
}

TEST(PropertyListTest, EqualityIgnoresTheOrderOfEntriesButNotOfElements) {
  for (const int count : {2, 5, 50}) {
    Entries forward;
    Entries backward;
    for (int i = 0; i < count; ++i) forward.emplace_back(std::to_string(i), PropertyList::integer(i));
    backward.assign(forward.rbegin(), forward.rend());
    const PropertyList one = PropertyList::dictionary(forward);
    EXPECT_EQ(one, PropertyList::dictionary(backward));
    backward.front().second = PropertyList::integer(-1);
    EXPECT_FALSE(one == PropertyList::dictionary(backward));
    backward.front() = {"other", forward.back().second};
    EXPECT_FALSE(one == PropertyList::dictionary(backward));
  }
  EXPECT_FALSE(PropertyList::array({text("a"), text("b")}) == PropertyList::array({text("b"), text("a")}));
  EXPECT_FALSE(PropertyList::array({text("a")}) == PropertyList::array({text("a"), text("a")}));
}

TEST(PropertyListTest, EqualityOfRealsTakesNotANumberForItself) {
  const double nan = std::numeric_limits<double>::quiet_NaN();
  EXPECT_EQ(PropertyList::real(nan), PropertyList::real(-nan));
  EXPECT_EQ(PropertyList::real(0.0), PropertyList::real(-0.0));
  EXPECT_FALSE(PropertyList::real(nan) == PropertyList::real(1));
  EXPECT_FALSE(PropertyList::real(1) == PropertyList::integer(1));
  EXPECT_FALSE(PropertyList::real(1) == PropertyList::date(1));
}

TEST(PropertyListTest, ValuesOfOtherDocumentsOutliveThem) {
  const std::string large(5000, 'x');
  PropertyList mixed;
  {
    const PropertyList parsed = parse(
        "<plist><dict><key>inner</key><array><string>short</string><data>AQID</data></array></dict></plist>");
    const PropertyList holder = PropertyList::array({parsed.find("inner"), text(large)});
    mixed = PropertyList::dictionary({{"array", holder.at(0)},
                                      {"large", holder.at(1)},
                                      {"holder", holder},
                                      {"element", parsed.find("inner").at(0)},
                                      {"empty", PropertyList::array({})}});
  }
  EXPECT_EQ(mixed.find("array").at(0).asString(), "short");
  EXPECT_EQ(mixed.find("array").at(1).asData().value().size(), 3u);
  EXPECT_EQ(mixed.find("large").asString(), large);
  EXPECT_EQ(mixed.find("holder").at(1).asString(), large);
  EXPECT_EQ(mixed.find("element").asString(), "short");
  EXPECT_EQ(mixed.find("empty").size(), 0u);
  PropertyList inner = mixed.find("holder").at(0);
  mixed = PropertyList();
  EXPECT_EQ(inner.at(0).asString(), "short");
}

TEST(PropertyListTest, SharesALargeValueInsteadOfCopyingIt) {
  const PropertyList value = text(std::string(100000, 'x'));
  const PropertyList array = PropertyList::array({value, value});
  EXPECT_EQ(array.at(0).asString().value().data(), value.asString().value().data());
  EXPECT_EQ(array.at(1).asString().value().data(), value.asString().value().data());
}

TEST(PropertyListTest, AssignmentToItselfAndFromItsOwnPartIsSafe) {
  PropertyList value = PropertyList::array({PropertyList::array({text(std::string(100, 'y'))})});
  const PropertyList& same = value;
  value = same;
  value = value.at(0);
  value = value.at(0);
  EXPECT_EQ(value.asString(), std::string(100, 'y'));
  PropertyList moved = std::move(value);
  EXPECT_EQ(moved.asString(), std::string(100, 'y'));
}

TEST(PropertyListTest, SetsReplacesAndRemovesAnEntryWithoutTouchingTheOthers) {
  for (const int count : {0, 3, 15, 16, 17, 18, 100}) {
    Entries entries;
    for (int i = 0; i < count; ++i) entries.emplace_back("key" + std::to_string(i), PropertyList::integer(i));
    const PropertyList before = PropertyList::dictionary(entries);

    const PropertyList added = before.withEntry("new", text("n"));
    EXPECT_EQ(added.size(), before.size() + 1);
    EXPECT_EQ(added.keyAt(before.size()), "new");
    EXPECT_EQ(added.withEntry("new", PropertyList()), before);
    EXPECT_EQ(before.withEntry("new", PropertyList()), before);
    for (int i = 0; i < count; ++i) {
      const std::string key = "key" + std::to_string(i);
      const PropertyList replaced = before.withEntry(key, text("r"));
      EXPECT_EQ(keysOf(replaced), keysOf(before));
      EXPECT_EQ(replaced.find(key).asString(), "r");
      const PropertyList removed = before.withEntry(key, PropertyList());
      EXPECT_EQ(removed.size(), before.size() - 1);
      EXPECT_FALSE(removed.find(key));
      for (int other = 0; other < count; ++other) {
        if (other == i) continue;
        EXPECT_EQ(removed.find("key" + std::to_string(other)).asInteger(), other);
      }
    }
  }
  EXPECT_FALSE(PropertyList::array({}).withEntry("a", text("b")));
  EXPECT_FALSE(PropertyList().withEntry("a", text("b")));
}

TEST(PropertyListTest, ADictionaryThatIsChangedAgainAndAgainDoesNotKeepItsPredecessors) {
  const PropertyList large = text(std::string(1000, 'x'));
  PropertyList value = PropertyList::dictionary({{"large", large}, {"nested", PropertyList::array({large})}});
  const char* const where = value.find("large").asString().value().data();
  const std::size_t before = ::mallinfo2().uordblks;
  for (int i = 0; i < 10000; ++i) value = value.withEntry("n", PropertyList::integer(i));
  EXPECT_LT(::mallinfo2().uordblks, before + 10000);
  EXPECT_EQ(value.find("large").asString().value().data(), where);
  EXPECT_EQ(value.find("n").asInteger(), 9999);
}

TEST(PropertyListTest, TheDeepestValueIsComparedAndDestroyedWithoutRecursion) {
  auto nest = [] {
    PropertyList value = text("bottom");
    for (int i = 0; i < 200000; ++i) value = PropertyList::array({std::move(value)});
    return value;
  };
  PropertyList one = nest();
  EXPECT_EQ(one, nest());
  EXPECT_FALSE(serializePropertyList(one, PropertyListFormat::xml));
  EXPECT_FALSE(serializePropertyList(one, PropertyListFormat::binary));
  one = PropertyList();
}

// 2 to the `levels` leaves, out of a few values.
PropertyList doubling(int levels, const PropertyList& leaf) {
  PropertyList value = leaf;
  for (int i = 0; i < levels; ++i) value = PropertyList::array({value, value});
  return value;
}

TEST(PropertyListTest, ValuesSharedExponentiallyAreComparedInLinearTime) {
  const PropertyList one = doubling(400, PropertyList::array({text("a")}));
  EXPECT_EQ(one, doubling(400, PropertyList::array({text("a")})));
  EXPECT_FALSE(one == doubling(400, PropertyList::array({text("b")})));
  EXPECT_FALSE(one == doubling(399, PropertyList::array({text("a")})));
}

TEST(PropertyListTest, ManySharedThingsThatMeetInManyPairsAreComparedInLinearTime) {
  // Each of n equal arrays on one side meets each of n on the other; comparing the pairs would take n*n
  // steps.
  constexpr std::size_t kThings = 1500;
  auto side = [](std::size_t shift) {
    std::vector<PropertyList> things;
    const PropertyList filler = PropertyList::array(std::vector<PropertyList>(100, PropertyList::integer(1)));
    for (std::size_t i = 0; i < kThings; ++i)
      things.push_back(PropertyList::array({filler, PropertyList::array({filler})}));
    std::vector<PropertyList> rows;
    for (std::size_t row = 0; row < 300; ++row) {
      std::vector<PropertyList> cells;
      for (std::size_t i = 0; i < kThings; ++i) cells.push_back(things[(i * (shift * row + 1)) % kThings]);
      rows.push_back(PropertyList::array(cells));
    }
    return PropertyList::array(rows);
  };
  EXPECT_EQ(side(0), side(7));
}

TEST(PropertyListTest, IsReadFromManyThreadsAtOnce) {
  const PropertyList value = parse(
      "<plist><dict><key>a</key><array><string>one</string><string>two</string></array></dict></plist>");
  std::vector<std::thread> readers;
  for (int i = 0; i < 4; ++i) {
    readers.emplace_back([value] {
      for (int round = 0; round < 2000; ++round) {
        const PropertyList copy = value;
        const PropertyList element = copy.find("a").at(1);
        ASSERT_EQ(element.asString(), "two");
        ASSERT_EQ(PropertyList::array({copy, element}).at(0), value);
      }
    });
  }
  for (std::thread& reader : readers) reader.join();
}

}  // namespace
}  // namespace brenvik
