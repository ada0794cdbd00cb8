// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/labeler/linux/CatalogueLabeler.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>
#include <set>
#include <sstream>
#include <string>
#include <vector>

namespace brenvik {
namespace {

using Texts = std::vector<std::string>;

PropertyList arrayOf(const Texts& texts) {
  std::vector<PropertyList> elements;
  for (const std::string& text : texts) elements.push_back(PropertyList::string(text));
  return PropertyList::array(std::move(elements));
}

Texts textsOf(const PropertyList& array) {
  Texts texts;
  for (std::size_t i = 0; i < array.size(); ++i)
    texts.emplace_back(array.at(i).asString().value_or("<not a text>"));
  return texts;
}

Texts names(const Texts& labels, const Texts& languages) {
  return textsOf(CatalogueLabeler().localizedLabels(arrayOf(labels), arrayOf(languages)));
}

Texts badges(const Texts& labels, const Texts& languages) {
  return textsOf(CatalogueLabeler().localizedBadgeLabels(arrayOf(labels), arrayOf(languages)));
}

const Texts kIdentifiers{std::string(label_identifier::primary),  std::string(label_identifier::secondary),
                         std::string(label_identifier::personal), std::string(label_identifier::business),
                         std::string(label_identifier::travel),   std::string(label_identifier::data)};

Texts split(const std::string& line, char separator) {
  Texts parts(1);
  for (const char c : line) {
    if (c == separator) {
      parts.emplace_back();
    } else {
      parts.back() += c;
    }
  }
  return parts;
}

// ---- The catalogues themselves, read a second time from what translators edit. ----

struct Source {
  std::string tag;
  Texts alsoServes;
  std::map<std::string, std::string> texts;  // by message
};

std::vector<Source> sources() {
  std::vector<Source> result;
  for (const auto& entry : std::filesystem::directory_iterator(BRENVIK_CATALOGUE_SOURCES)) {
    if (entry.path().extension() != ".po") continue;
    Source source{entry.path().stem(), {}, {}};
    std::ifstream file(entry.path());
    std::string message;
    std::string header;
    for (std::string line; std::getline(file, line);) {
      const std::size_t quote = line.find('"');
      if (quote == std::string::npos || line[0] == '#') continue;
      const std::string text = line.substr(quote + 1, line.size() - quote - 2);
      if (line.starts_with("msgid")) {
        message = text;
      } else if (line.starts_with("msgstr")) {
        if (!message.empty()) source.texts[message] = text;
      } else if (line.starts_with('"')) {
        header += text;
      }
    }
    const std::size_t also = header.find("X-Also-Serves: ");
    if (also != std::string::npos) {
      const std::size_t start = also + std::string("X-Also-Serves: ").size();
      source.alsoServes = split(header.substr(start, header.find("\\n", start) - start), ' ');
    }
    result.push_back(std::move(source));
  }
  return result;
}

TEST(CatalogueLabelerTest, EveryCatalogueHasAllSixLabelsAndIsServedAsItsTranslatorWroteIt) {
  const std::vector<Source> all = sources();
  EXPECT_GE(all.size(), 40U);
  for (const Source& source : all) {
    SCOPED_TRACE(source.tag);
    ASSERT_EQ(source.texts.size(), 6U);
    const auto& texts = source.texts;
    const Texts expected{texts.at("Primary"),  texts.at("Secondary"), texts.at("Personal"),
                         texts.at("Business"), texts.at("Travel"),    texts.at("Cellular Data")};
    for (const std::string& text : expected) EXPECT_FALSE(text.empty());
    EXPECT_EQ(names(kIdentifiers, {source.tag}), expected);
    for (const std::string& tag : source.alsoServes) EXPECT_EQ(names(kIdentifiers, {tag}), expected) << tag;
  }
}

TEST(CatalogueLabelerTest, TheLabelsOfOneLanguageDifferFromOneAnother) {
  for (const Source& source : sources()) {
    const Texts texts = names(kIdentifiers, {source.tag});
    EXPECT_EQ(std::set<std::string>(texts.begin(), texts.end()).size(), 6U) << source.tag;
  }
}

// ---- The table written by hand. ----

TEST(CatalogueLabelerTest, EveryRowOfTheTableIsAnsweredAsItsReaderExpects) {
  const std::map<std::string, std::string> identifiers{
      {"USER_LABEL_PRIMARY", kIdentifiers[0]},  {"USER_LABEL_SECONDARY", kIdentifiers[1]},
      {"USER_LABEL_PERSONAL", kIdentifiers[2]}, {"USER_LABEL_BUSINESS", kIdentifiers[3]},
      {"USER_LABEL_TRAVEL", kIdentifiers[4]},   {"USER_LABEL_CELL_DATA", kIdentifiers[5]}};
  std::ifstream file(BRENVIK_LABEL_TABLE);
  std::set<std::string> rows;
  for (std::string line; std::getline(file, line);) {
    if (line.starts_with('#')) continue;
    SCOPED_TRACE(line);
    EXPECT_TRUE(rows.insert(line).second) << "the row stands there twice";
    const Texts columns = split(line, '\t');
    ASSERT_EQ(columns.size(), 4U);
    const Texts languages = columns[0].empty() ? Texts{} : split(columns[0], ',');
    const std::string label = columns[1].starts_with('"') ? columns[1].substr(1, columns[1].size() - 2)
                                                          : identifiers.at(columns[1]);
    EXPECT_EQ(names({label}, languages), Texts{columns[2]});
    EXPECT_EQ(badges({label}, languages), Texts{columns[3]});
  }
  EXPECT_GE(rows.size(), 200U);
}

// ---- What is passed in. ----

TEST(CatalogueLabelerTest, NoLanguagesAndNoSuchArgumentBothMeanEnglish) {
  CatalogueLabeler labeler;
  const PropertyList label = arrayOf({kIdentifiers[5]});
  EXPECT_EQ(textsOf(labeler.localizedLabels(label, PropertyList())), (Texts{"Cellular Data"}));
  EXPECT_EQ(textsOf(labeler.localizedLabels(label, arrayOf({}))), (Texts{"Cellular Data"}));
  EXPECT_EQ(textsOf(labeler.localizedBadgeLabels(label, PropertyList())), (Texts{"C"}));
}

TEST(CatalogueLabelerTest, NoLabelsGiveAnEmptyArrayAndNotNothing) {
  CatalogueLabeler labeler;
  EXPECT_TRUE(labeler.localizedLabels(arrayOf({}), PropertyList()).is(PropertyList::Type::array));
  EXPECT_EQ(names({}, {"de"}), Texts{});
  EXPECT_TRUE(labeler.localizedBadgeLabels(arrayOf({}), PropertyList()).is(PropertyList::Type::array));
}

TEST(CatalogueLabelerTest, ElementsThatAreNotTextsArePassedOver) {
  const PropertyList labels =
      PropertyList::array({PropertyList::integer(7), PropertyList::string("Mine"),
                           PropertyList::dictionary({{"a", PropertyList::boolean(true)}}),
                           PropertyList::string(kIdentifiers[4])});
  const PropertyList languages = PropertyList::array({PropertyList::boolean(true), PropertyList::data({}),
                                                      PropertyList::string("fr"), PropertyList::real(1.5)});
  CatalogueLabeler labeler;
  EXPECT_EQ(textsOf(labeler.localizedLabels(labels, languages)), (Texts{"Mine", "Voyage"}));
  EXPECT_EQ(textsOf(labeler.localizedBadgeLabels(labels, languages)), (Texts{"M", "V"}));
}

TEST(CatalogueLabelerTest, OverlongAndMalformedLanguagesAreFollowedAsFarAsTheyMakeSense) {
  EXPECT_EQ(names({kIdentifiers[4]}, {"de-" + std::string(1000000, 'a')}), (Texts{"Reise"}));
  EXPECT_EQ(names({kIdentifiers[4]}, {"de-latn-at-1996-xx-yy-zz-and-so-on"}), (Texts{"Reise"}));
  EXPECT_EQ(names({kIdentifiers[4]}, {"de--AT"}), (Texts{"Reise"}));
  EXPECT_EQ(names({kIdentifiers[4]}, {"", "-", "--", "de ", "d\xC3\xA9", std::string("de\0", 3), "fr"}),
            (Texts{"Voyage"}));
  // Put together beforehand: g++ 12 sees overlaps in a concatenation within a list that are not there.
  std::string overlong(100, 'd');
  overlong += "-x";
  EXPECT_EQ(names({kIdentifiers[4]}, {overlong, "abcdefghijklmno", "abcdefghijklmnop"}), (Texts{"Travel"}));
  EXPECT_EQ(names({kIdentifiers[4]}, {"zh-yue-hans", "fr"}), (Texts{"旅行"}));
}

// ---- Badges of several labels in one request. ----

TEST(CatalogueLabelerTest, LabelsWithTheSameFirstLetterGetMoreOfTheirLetters) {
  EXPECT_EQ(badges(kIdentifiers, {"en"}), (Texts{"P", "S", "PE", "B", "T", "C"}));
  EXPECT_EQ(badges({"Ann", "Anna", "Annabel", "Anton"}, {"en"}), (Texts{"A", "AN", "ANN", "ANT"}));
}

TEST(CatalogueLabelerTest, LabelsWhoseLettersAreUsedUpGetNumbers) {
  EXPECT_EQ(badges(Texts(6, "Business"), {"en"}), (Texts{"B", "BU", "BUS", "B2", "B3", "B4"}));
  EXPECT_EQ(badges({"א", "א", "א"}, {"he"}), (Texts{"א", "א2", "א3"}));
  EXPECT_EQ(badges({"B2", "B", "B", "B"}, {"en"}), (Texts{"B", "B2", "B3", "B4"}));
}

TEST(CatalogueLabelerTest, LabelsOfWhichNothingCanBeSeenGetNumbersAlone) {
  EXPECT_EQ(badges({"", " \t\n", "\xE2\x80\x8D\xC2\xAD", std::string("\x01\0\x7F", 3), "1"}, {"en"}),
            (Texts{"1", "2", "3", "4", "12"}));
}

TEST(CatalogueLabelerTest, BlanksAndInvisibleCharactersNeverCount) {
  EXPECT_EQ(badges({"A b", "a B", "A  b c",
                    "\xE2\x80\x8F"
                    "A bc"},
                   {"en"}),
            (Texts{"A", "AB", "ABC", "A2"}));
}

TEST(CatalogueLabelerTest, BadgesThatLookAlikeAreAlikeWhateverStoodBetweenALetterAndItsMark) {
  constexpr const char* kSoftHyphenAndAcute = "A\xC2\xAD\xCC\x81";
  EXPECT_EQ(badges({"A", kSoftHyphenAndAcute, "Á", "áb"}, {"en"}), (Texts{"A", "Á", "Á2", "ÁB"}));
}

TEST(CatalogueLabelerTest, BadgesThatDifferOnlyInWhatNobodySeesAreAlike) {
  EXPECT_EQ(badges({"A", "A\xE2\x80\x8D", "A\xEF\xB8\x8F"}, {"en"}), (Texts{"A",
                                                                            "A\xE2\x80\x8D"
                                                                            "2",
                                                                            "A\xEF\xB8\x8F"
                                                                            "3"}));
  EXPECT_EQ(badges({"👨‍👩‍👧", "👨‍👩‍👦", "🏴󠁧󠁢󠁥󠁮󠁧󠁿",
                    "🏴󠁧󠁢󠁳󠁣󠁴󠁿"},
                   {"en"}),
            (Texts{"👨‍👩‍👧", "👨‍👩‍👦", "🏴󠁧󠁢󠁥󠁮󠁧󠁿",
                   "🏴󠁧󠁢󠁳󠁣󠁴󠁿"}));
}

TEST(CatalogueLabelerTest, SharpSGivesOneLetterAndThenTheNext) {
  EXPECT_EQ(badges({"ß", "ß", "ße", "ße"}, {"de"}), (Texts{"S", "SS", "SSE", "S2"}));
}

TEST(CatalogueLabelerTest, GeorgianBadgesKeepEverydayLettersWhateverTheLanguage) {
  // Two begin alike, and then have their first two letters.
  EXPECT_EQ(badges(kIdentifiers, {"ka"}), (Texts{"ძ", "დ", "პ", "ბ", "მ", "მო"}));
  for (const char* language : {"ka", "en", "el", "tr"}) {
    EXPECT_EQ(badges({"სახლი", "სამსახური", "ა b", "ab გ"}, {language}), (Texts{"ს", "სა", "ა", "A"}))
        << language;
  }
  // Capitals that somebody wrote are that person's.
  EXPECT_EQ(badges({"Ს"}, {"ka"}), (Texts{"Ს"}));
}

TEST(CatalogueLabelerTest, ConjunctsOfIndicScriptsAreOneLetter) {
  EXPECT_EQ(badges({"व्यापार", "व्याकरण", "व्यापक", "व्यापक"}, {"hi"}), (Texts{"व्या", "व्याक", "व्याप", "व्या2"}));
  EXPECT_EQ(badges({"ప్రయాణం", "ప్రాథమిక"}, {"te"}), (Texts{"ప్ర", "ప్రా"}));
  EXPECT_EQ(badges({"க்ஷ"}, {"ta"}), (Texts{"க்"}));
}

TEST(CatalogueLabelerTest, ABadgeIsShortHoweverManyMarksItsLabelPilesUp) {
  std::string pile = "a";
  for (int i = 0; i < 100000; ++i) pile += "\xCC\x81";
  const Texts made = badges({pile, pile}, {"en"});
  ASSERT_EQ(made.size(), 2U);
  for (const std::string& badge : made) EXPECT_LE(badge.size(), 3 * 32 * 4U);
  EXPECT_TRUE(made[0].starts_with("\xC3\x81"));
}

TEST(CatalogueLabelerTest, ManyEqualLabelsStillGetDistinctBadgesUntilThereAreNoMore) {
  const Texts made = badges(Texts(40000, "Line"), {"en"});
  ASSERT_EQ(made.size(), 40000U);
  EXPECT_EQ(std::set<std::string>(made.begin(), made.end()).size(), 40000U);
  EXPECT_EQ(std::ranges::max(made, {}, &std::string::size).size(), 3U);
  EXPECT_EQ(Texts(made.begin(), made.begin() + 5), (Texts{"L", "LI", "LIN", "L2", "L3"}));
  EXPECT_EQ(Texts(made.begin() + 99, made.begin() + 103), (Texts{"L98", "L99", "1", "2"}));
  EXPECT_FALSE(
      CatalogueLabeler().localizedBadgeLabels(arrayOf(Texts(50000, "Line")), PropertyList()).hasValue());
}

}  // namespace
}  // namespace brenvik
