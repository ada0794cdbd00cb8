// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/EditableDictionary.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <map>
#include <random>
#include <span>
#include <string>

#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

PropertyList parse(std::string_view bytes) { return parsePropertyList(std::as_bytes(std::span(bytes))); }

std::string contentOf(EditableDictionary& edited) {
  const auto pieces = edited.content();
  return std::string(pieces[0]) + std::string(pieces[1]);
}

PropertyList written(EditableDictionary& edited) { return parse(contentOf(edited)); }

PropertyList dictionaryOf(const std::map<std::string, PropertyList>& model) {
  return PropertyList::dictionary({model.begin(), model.end()});
}

PropertyList numbers(std::size_t count) {
  std::vector<PropertyList> elements;
  for (std::size_t i = 0; i < count; ++i)
    elements.push_back(PropertyList::integer(static_cast<std::int64_t>(i)));
  return PropertyList::array(std::move(elements));
}

TEST(EditableDictionaryTest, AnEmptyImageIsAnEmptyDictionary) {
  EditableDictionary edited;
  EXPECT_EQ(written(edited), PropertyList::dictionary({}));
  EXPECT_FALSE(edited.find("key"));
  EXPECT_EQ(edited.set("key", {}), EditableDictionary::Change::none);
}

TEST(EditableDictionaryTest, OnlyADictionaryBecomesAnImage) {
  EXPECT_FALSE(EditableDictionary::of({}));
  EXPECT_FALSE(EditableDictionary::of(PropertyList::array({})));
  EXPECT_FALSE(EditableDictionary::of(PropertyList::string("text")));
}

TEST(EditableDictionaryTest, SettingWhatStandsAlreadyChangesNothing) {
  EditableDictionary edited;
  for (const auto& value : {PropertyList::string("text"), numbers(20), PropertyList::dictionary({})}) {
    EXPECT_EQ(edited.set("key", value), EditableDictionary::Change::made);
    EXPECT_EQ(edited.set("key", value), EditableDictionary::Change::none);
  }
}

// Every way an entry can change its size and its number of objects, at random, against a plain map: with few
// keys, and with enough of them to pass the limits at which references take two and four bytes.
TEST(EditableDictionaryTest, AfterAnyChangesItHoldsWhatAMapWouldHold) {
  std::mt19937 random(20240229);
  const auto below = [&random](std::size_t limit) { return random() % limit; };
  const auto anyValue = [&]() -> PropertyList {
    switch (below(8)) {
      case 0:
        return {};
      case 1:
        return PropertyList::integer(static_cast<std::int64_t>(random()) - 0x40000000);
      case 2:
        return PropertyList::string(std::string(below(40), 'x'));
      case 3:
        return PropertyList::string("\xE2\x82\xAC" + std::string(below(300), 'y'));
      case 4:
        return numbers(below(30));
      case 5: {
        const PropertyList shared = numbers(below(4));
        return PropertyList::array(
            {shared, PropertyList::dictionary({{"a", shared}, {"b", shared}}), shared});
      }
      case 6:
        return PropertyList::boolean(below(2) == 0);
      default:
        return PropertyList::dictionary({{"Version", PropertyList::string(std::to_string(random()))}});
    }
  };
  const struct {
    std::size_t keys;
    int changes;
  } runs[] = {{5, 400}, {100, 600}, {300, 1500}};
  for (const auto& run : runs) {
    EditableDictionary edited;
    std::map<std::string, PropertyList> model;
    for (int i = 0; i < run.changes; ++i) {
      std::string key = (below(5) == 0 ? "\xC3\xA9" : "key ") + std::to_string(below(run.keys));
      const PropertyList value = anyValue();
      ASSERT_NE(edited.set(key, value), EditableDictionary::Change::refused);
      if (value) {
        model[key] = value;
      } else {
        model.erase(key);
      }
      ASSERT_EQ(edited.size(), model.size());
      ASSERT_EQ(edited.find(key), value);
      if (i % 50 != 0) continue;
      ASSERT_EQ(written(edited), dictionaryOf(model));
      for (const auto& [name, expected] : model) ASSERT_EQ(edited.find(name), expected) << name;
      // And from a file like this one, too.
      if (i % 200 == 0) edited = *EditableDictionary::of(written(edited));
    }
    EXPECT_EQ(written(edited), dictionaryOf(model));
  }
}

TEST(EditableDictionaryTest, ReferencesGrowWithTheNumberOfObjects) {
  EditableDictionary edited;
  std::map<std::string, PropertyList> model;
  model["nested"] = PropertyList::array({numbers(3), PropertyList::dictionary({{"a", numbers(2)}})});
  ASSERT_EQ(edited.set("nested", model["nested"]), EditableDictionary::Change::made);
  for (int i = 0; i < 33'000; ++i) {
    const std::string key = "key" + std::to_string(i);
    model[key] = PropertyList::integer(i);
    ASSERT_EQ(edited.set(key, model[key]), EditableDictionary::Change::made);
    // One object on the file's end, two for each entry: 256 and 65,536 objects are passed on the way.
    if ((i > 100 && i < 140) || (i > 32'745 && i < 32'775)) {
      ASSERT_EQ(edited.find("nested"), model["nested"]) << i;
      if (i < 140 || i % 8 == 0) {
        ASSERT_EQ(written(edited), dictionaryOf(model)) << i;
      }
    }
  }
  EXPECT_EQ(written(edited), dictionaryOf(model));
  model["nested"] = numbers(1);
  ASSERT_EQ(edited.set("nested", model["nested"]), EditableDictionary::Change::made);
  model.erase("key7");
  ASSERT_EQ(edited.set("key7", {}), EditableDictionary::Change::made);
  EXPECT_EQ(written(edited), dictionaryOf(model));
}

TEST(EditableDictionaryTest, PartsSharedBetweenEntriesArePartedAndPartsSharedWithinOneAreNot) {
  const PropertyList shared = numbers(50);
  std::vector<std::pair<std::string, PropertyList>> entries;
  for (int i = 0; i < 100; ++i)
    entries.emplace_back("k" + std::to_string(i), PropertyList::array({shared, shared, shared}));
  const auto document = PropertyList::dictionary(entries);
  auto edited = EditableDictionary::of(parse(*serializePropertyList(document, PropertyListFormat::binary)));
  ASSERT_TRUE(edited);
  EXPECT_EQ(written(*edited), document);
  ASSERT_EQ(edited->set("k5", PropertyList::integer(1)), EditableDictionary::Change::made);
  EXPECT_EQ(edited->find("k6"), entries[6].second);

  // A quarter of a million elements if sharing were lost.
  PropertyList doubled = PropertyList::array({PropertyList::boolean(true)});
  for (int i = 0; i < 18; ++i) doubled = PropertyList::array({doubled, doubled});
  ASSERT_EQ(edited->set("doubled", doubled), EditableDictionary::Change::made);
  EXPECT_LT(contentOf(*edited).size(), 100'000u);
  EXPECT_EQ(edited->find("doubled"), doubled);
}

TEST(EditableDictionaryTest, AValueIsRefusedThatWouldMakeTheDomainUnreadable) {
  EditableDictionary edited;
  ASSERT_EQ(edited.set("stays", PropertyList::string("here")), EditableDictionary::Change::made);
  PropertyList deep = PropertyList::integer(1);
  for (std::size_t i = 0; i < kMaxPropertyListDepth - 1; ++i) deep = PropertyList::array({deep});
  EXPECT_EQ(edited.set("deep", deep), EditableDictionary::Change::made);
  EXPECT_TRUE(written(edited)) << "just as deep as can be read";
  EXPECT_EQ(edited.set("deeper", PropertyList::array({deep})), EditableDictionary::Change::refused);
  EXPECT_EQ(edited.set("large", PropertyList::string(std::string(EditableDictionary::kMaxFileSize, 'x'))),
            EditableDictionary::Change::refused);
  EXPECT_EQ(edited.set("stays", PropertyList::string(std::string(EditableDictionary::kMaxFileSize, 'x'))),
            EditableDictionary::Change::refused);
  EXPECT_EQ(edited.set("\xC0", PropertyList::integer(1)), EditableDictionary::Change::refused);
  EXPECT_EQ(written(edited),
            PropertyList::dictionary({{"stays", PropertyList::string("here")}, {"deep", deep}}));
}

TEST(EditableDictionaryTest, AnEmptyContainerIsALevelToo) {
  for (const PropertyList& empty : {PropertyList::array({}), PropertyList::dictionary({})}) {
    EditableDictionary edited;
    PropertyList deep = empty;
    for (std::size_t i = 1; i < kMaxPropertyListDepth - 1; ++i) deep = PropertyList::array({deep});
    EXPECT_EQ(edited.set("deep", deep), EditableDictionary::Change::made);
    EXPECT_TRUE(written(edited)) << "just as deep as can be read";
    EXPECT_EQ(edited.set("deeper", PropertyList::array({deep})), EditableDictionary::Change::refused);
    EXPECT_TRUE(written(edited)) << "still";
  }
}

TEST(EditableDictionaryTest, EntriesThatAreLegalAloneAreRefusedWhenTheirXmlFormTogetherPassesTheLimit) {
  // More than ten MiB as XML, some hundred bytes here.
  PropertyList expanding = PropertyList::array({PropertyList::boolean(true)});
  for (int i = 0; i < 17; ++i) expanding = PropertyList::array({expanding, expanding});
  EditableDictionary edited;
  std::map<std::string, PropertyList> model;
  int accepted = 0;
  for (int i = 0; i < 8; ++i) {
    const std::string key = "key" + std::to_string(i);
    if (edited.set(key, expanding) == EditableDictionary::Change::refused) continue;
    ++accepted;
    model[key] = expanding;
  }
  EXPECT_GE(accepted, 1);
  EXPECT_LT(accepted, 8);
  EXPECT_EQ(written(edited), dictionaryOf(model));
  // What was refused changed nothing, and smaller things still fit.
  EXPECT_EQ(edited.set("small", PropertyList::integer(1)), EditableDictionary::Change::made);
  EXPECT_EQ(edited.find("small").asInteger(), 1);
  EXPECT_TRUE(written(edited));
}

TEST(EditableDictionaryTest, SettingOneLargeValueAgainAndAgainDoesNotUseUpTheLimit) {
  EditableDictionary edited;
  for (int i = 0; i < 40; ++i) {
    const std::string text(2'000'000, static_cast<char>('a' + i % 26));
    ASSERT_EQ(edited.set("key", PropertyList::string(text)), EditableDictionary::Change::made) << i;
  }
  EXPECT_EQ(edited.find("key").asString()->size(), 2'000'000u);
}

}  // namespace
}  // namespace brenvik
