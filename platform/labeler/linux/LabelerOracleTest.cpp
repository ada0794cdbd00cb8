// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Compares the labeler with ICU, which shares no code and no tables with it, over random input with fixed
// seeds.
#include <gtest/gtest.h>
#include <unicode/brkiter.h>
#include <unicode/localebuilder.h>
#include <unicode/localematcher.h>
#include <unicode/normalizer2.h>
#include <unicode/uchar.h>
#include <unicode/unistr.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <memory>
#include <random>
#include <set>
#include <span>
#include <string>
#include <vector>

#include "platform/labeler/linux/Catalogue.h"
#include "platform/labeler/linux/CatalogueLabeler.h"
#include "platform/labeler/linux/Uppercase.h"

namespace brenvik {
namespace {

using Texts = std::vector<std::string>;

Texts catalogueTags() {
  Texts tags;
  for (const auto& entry : std::filesystem::directory_iterator(BRENVIK_CATALOGUE_SOURCES)) {
    if (entry.path().extension() == ".po") tags.push_back(entry.path().stem());
  }
  std::sort(tags.begin(), tags.end());
  return tags;
}

icu::UnicodeString composed(const icu::UnicodeString& text) {
  UErrorCode status = U_ZERO_ERROR;
  return icu::Normalizer2::getNFCInstance(status)->normalize(text, status);
}

std::string utf8(const icu::UnicodeString& text) {
  std::string result;
  text.toUTF8String(result);
  return result;
}

// Without what ICU counts among the characters that nobody sees, but with the tags that make up flags.
std::string visiblePartOf(const std::string& text) {
  const icu::UnicodeString characters = icu::UnicodeString::fromUTF8(text);
  icu::UnicodeString seen;
  for (std::int32_t i = 0; i < characters.length(); i = characters.moveIndex32(i, 1)) {
    const UChar32 c = characters.char32At(i);
    const bool isTag = c >= 0xE0020 && c <= 0xE007F;
    if (isTag || !u_hasBinaryProperty(c, UCHAR_DEFAULT_IGNORABLE_CODE_POINT)) seen.append(c);
  }
  return utf8(composed(seen));
}

// ICU's capitals, composed, with one deliberate difference: Georgian letters stay the everyday ones. (No
// piece of text below has Georgian capitals of its own.)
icu::UnicodeString capitals(const std::string& text, const std::string& language) {
  UErrorCode status = U_ZERO_ERROR;
  const icu::Locale locale = icu::Locale::forLanguageTag(language, status);
  const icu::UnicodeString upper = composed(icu::UnicodeString::fromUTF8(text).toUpper(locale));
  icu::UnicodeString result;
  for (std::int32_t i = 0; i < upper.length(); i = upper.moveIndex32(i, 1)) {
    const UChar32 c = upper.char32At(i);
    const bool isGeorgianCapital = ublock_getCode(c) == UBLOCK_GEORGIAN_EXTENDED;
    result.append(isGeorgianCapital ? u_tolower(c) : c);
  }
  return result;
}

class Clusters {
 public:
  Clusters() : iterator_(icu::BreakIterator::createCharacterInstance(icu::Locale::getRoot(), status_)) {}
  std::int32_t count(const std::string& text) {
    // Some releases of ICU (76) part the flags of regions at each tag, against the rules: a tag extends what
    // is before it.
    icu::UnicodeString counted = icu::UnicodeString::fromUTF8(text);
    for (std::int32_t i = 0; i < counted.length();) {
      const UChar32 c = counted.char32At(i);
      if (c >= 0xE0020 && c <= 0xE007F) {
        counted.remove(i, U16_LENGTH(c));
      } else {
        i += U16_LENGTH(c);
      }
    }
    iterator_->setText(counted);
    std::int32_t clusters = 0;
    while (iterator_->next() != icu::BreakIterator::DONE) ++clusters;
    return clusters;
  }
  icu::UnicodeString first(const icu::UnicodeString& text) {
    iterator_->setText(text);
    const std::int32_t end = iterator_->next();
    return end == icu::BreakIterator::DONE ? icu::UnicodeString() : text.tempSubString(0, end);
  }

 private:
  UErrorCode status_ = U_ZERO_ERROR;
  const std::unique_ptr<icu::BreakIterator> iterator_;
};

// Pieces of text that have something to them; every script a catalogue is written in is among them.
constexpr const char* kPieces[] = {"a",        "i",
                                   "I",        "ı",
                                   "İ",        "i̇",
                                   "į",        "į̇",
                                   "j́",        "ß",
                                   "ẞ",        "ŉ",
                                   "ﬁ",        "ﬃ",
                                   "é",        "é",
                                   "ǆ",        "ǰ",
                                   "ų",        "ij",
                                   "ĳ",        "å",
                                   "œ",        "ñ",
                                   "ș",        "ʼ",
                                   "'",        "-",
                                   ".",        "1",
                                   "α",        "ά",
                                   "ά",        "έ",
                                   "ή",        "ί",
                                   "ό",        "ύ",
                                   "ώ",        "ϊ",
                                   "ΐ",        "ϋ",
                                   "ΰ",        "ι",
                                   "υ",        "η",
                                   "ᾳ",        "ᾴ",
                                   "ᾆ",        "ἀ",
                                   "Ἀ",        "ὦ",
                                   "ῆ",        "ς",
                                   "σ",        "Ή",
                                   "Ά",        "Ϊ",
                                   "ρ",        "ῥ",
                                   "ϐ",        "ᾍ",
                                   "Ω",        "μ",
                                   "µ",        "ϑ",
                                   "և",        "ե",
                                   "վ",        "Ա",
                                   "ж",        "й",
                                   "ё",        "ї",
                                   "ъ",        "ქ",
                                   "თ",        "ა́",
                                   "ჰჼ",       "ə",
                                   "ғ",        "ش",
                                   "أ",        "بّ",
                                   "لا",       "ک",
                                   "א",        "שׁ",
                                   "हि",       "क्ष",
                                   "मु",        "व्य",
                                   "ু",         "গৌ",
                                   "ਨਿੱ",       "મુ",
                                   "மு",       "మొ",
                                   "ಮೊ",       "യാ",
                                   "ที่",        "เ",
                                   "ส่",        "ច",
                                   "ကို",        "한",
                                   "ㅎ",       "각",
                                   "が",       "か゛",
                                   "中",       "👨‍👩‍👧",
                                   "👍🏽", "🇩🇪",
                                   "🇫",        "❤️",
                                   "1️⃣",  "🏴󠁧󠁢󠁥󠁮󠁧󠁿",
                                   "ᚠ",        "𐐨",
                                   "𝒳"};

constexpr const char* kLanguages[] = {"en", "de", "tr", "az", "lt", "el",         "hy",     "nl",
                                      "ru", "ka", "ar", "hi", "th", "zh-Hant-TW", "sr-Latn"};

class RandomTexts {
 public:
  explicit RandomTexts(std::uint32_t seed) : random_(seed) {}
  std::size_t below(std::size_t bound) { return random_() % bound; }
  std::string oneOf(std::span<const char* const> texts) { return texts[below(texts.size())]; }
  const std::string& oneOf(const Texts& texts) { return texts[below(texts.size())]; }
  // Up to `longest` pieces, words apart now and then, seldom empty.
  std::string label(std::size_t longest) {
    std::string text;
    for (std::size_t count = below(longest + 1); count > 0; --count) {
      text += oneOf(kPieces);
      if (below(6) == 0) text += ' ';
    }
    return text;
  }

 private:
  std::mt19937 random_;
};

TEST(LabelerOracleTest, CapitalsAreThoseOfIcuButForGeorgian) {
  RandomTexts random(20240611);
  int compared = 0;
  for (int round = 0; round < 60000; ++round) {
    const std::string language = random.oneOf(kLanguages);
    const std::string text = random.label(8);
    const std::string code = language.substr(0, language.find('-'));
    ASSERT_EQ(upperCased(text, code.c_str()), utf8(capitals(text, language)))
        << language << ": \"" << text << '"';
    ++compared;
  }
  EXPECT_EQ(compared, 60000);
}

TEST(LabelerOracleTest, ASingleBadgeIsTheFirstClusterOfTheCapitalsThatIcuFinds) {
  RandomTexts random(19700101);
  Clusters clusters;
  CatalogueLabeler labeler;
  int compared = 0;
  for (int round = 0; round < 30000; ++round) {
    const std::string language = random.oneOf(kLanguages);
    const std::string text = random.label(8);
    if (text.empty() || text.front() == ' ') continue;
    const PropertyList badges =
        labeler.localizedBadgeLabels(PropertyList::array({PropertyList::string(text)}),
                                     PropertyList::array({PropertyList::string(language)}));
    ASSERT_EQ(badges.size(), 1U);
    ASSERT_EQ(badges.at(0).asString().value(), utf8(clusters.first(capitals(text, language))))
        << language << ": \"" << text << '"';
    ++compared;
  }
  EXPECT_GT(compared, 20000);
}

TEST(LabelerOracleTest, BadgesOfRandomListsAreDistinctShortAndTheSameEveryTime) {
  const Texts identifiers{std::string(label_identifier::primary),  std::string(label_identifier::secondary),
                          std::string(label_identifier::personal), std::string(label_identifier::business),
                          std::string(label_identifier::travel),   std::string(label_identifier::data)};
  const Texts tags = catalogueTags();
  RandomTexts random(31415926);
  Clusters clusters;
  for (int round = 0; round < 3000; ++round) {
    std::vector<PropertyList> labels;
    std::string trace;
    for (std::size_t count = 1 + random.below(24); count > 0; --count) {
      std::string label = random.below(3) == 0 ? random.oneOf(identifiers) : random.label(3);
      // Something invisible between a letter and its mark.
      if (random.below(8) == 0) label += "a\u00AD\u0301";
      if (random.below(8) == 0) label += random.below(2) == 0 ? "\u200D" : "\u200D\u0301";
      labels.push_back(PropertyList::string(label));
      trace += label + "|";
    }
    const std::string language = random.oneOf(tags);
    SCOPED_TRACE(language + ": " + trace);
    const PropertyList request = PropertyList::array(labels);
    const PropertyList languages = PropertyList::array({PropertyList::string(language)});
    const PropertyList made = CatalogueLabeler().localizedBadgeLabels(request, languages);
    ASSERT_EQ(made.size(), labels.size());
    std::set<std::string> seen;
    for (std::size_t i = 0; i < made.size(); ++i) {
      const std::string badge(made.at(i).asString().value());
      EXPECT_TRUE(seen.insert(visiblePartOf(badge)).second) << "twice: " << badge;
      EXPECT_EQ(badge, utf8(composed(icu::UnicodeString::fromUTF8(badge))));
      EXPECT_GE(clusters.count(badge), 1);
      EXPECT_LE(clusters.count(badge), 3) << badge;
    }
    EXPECT_EQ(made, CatalogueLabeler().localizedBadgeLabels(request, languages));
  }
}

// ICU's matcher measures how near languages are; ours looks up. They agree wherever a tag says nothing that
// sets it against its catalogue's script, and no catalogue of another language is near.
class MatcherOracle {
 public:
  MatcherOracle() : tags_(catalogueTags()) {
    std::vector<icu::Locale> locales;
    for (const std::string& tag : tags_) locales.push_back(icu::Locale::forLanguageTag(tag, status_));
    locales_ = locales;
    icu::LocaleMatcher::Builder builder;
    builder.setSupportedLocales(locales_.begin(), locales_.end());
    const icu::Locale english("en");
    builder.setDefaultLocale(&english);
    matcher_ = std::make_unique<icu::LocaleMatcher>(builder.build(status_));
  }
  const Texts& tags() const { return tags_; }
  std::string match(const Texts& ranges) {
    std::vector<icu::Locale> wanted;
    for (const std::string& range : ranges) wanted.push_back(icu::Locale::forLanguageTag(range, status_));
    using Iterator = icu::Locale::RangeIterator<std::vector<icu::Locale>::iterator>;
    Iterator iterator(wanted.begin(), wanted.end());
    const icu::Locale* const best = matcher_->getBestMatch(iterator, status_);
    EXPECT_TRUE(U_SUCCESS(status_)) << u_errorName(status_);
    return best == nullptr ? "" : best->toLanguageTag<std::string>(status_);
  }

 private:
  UErrorCode status_ = U_ZERO_ERROR;
  Texts tags_;
  std::vector<icu::Locale> locales_;
  std::unique_ptr<icu::LocaleMatcher> matcher_;
};

std::string ours(const Texts& ranges, const Texts& tags) {
  const catalogue::Catalogue* found = nullptr;
  for (std::size_t i = 0; i < ranges.size() && found == nullptr; ++i) found = LabelCatalogue::find(ranges[i]);
  if (found == nullptr) return "en";
  for (const std::string& tag : tags) {
    if (LabelCatalogue::find(tag) == found) return tag;
  }
  return "<none>";
}

TEST(LabelerOracleTest, LanguagesWithAndWithoutRegionMatchAsInIcu) {
  MatcherOracle oracle;
  const Texts regions{"US", "GB", "AU", "CA", "IN", "IE", "NZ", "ZA", "SG",  "PH", "DE", "AT",
                      "CH", "FR", "BE", "LU", "ES", "MX", "AR", "CO", "419", "BR", "PT", "AO",
                      "MZ", "TW", "HK", "MO", "CN", "RS", "BA", "HR", "TR",  "CY", "GR", "IL",
                      "EG", "SA", "IR", "PK", "KZ", "KE", "JP", "KR", "NO",  "SE", "RU", "UA"};
  // For English, Spanish and Portuguese elsewhere ICU groups whole continents with one variant, and it takes
  // a Croatian of Bosnia for a Bosnian; a look-up knows the countries its catalogues name, and otherwise the
  // language itself.
  const std::map<std::string, Texts> regionsOf{
      {"en",
       {"US", "CA", "PH", "GB", "AU", "IN", "IE", "NZ", "ZA", "SG", "HK", "KE", "PK", "IL", "CY", "DE",
        "CH"}},
      {"pt", {"BR", "PT", "AO", "MZ", "CH", "FR", "LU", "MO", "US", "MX", "AR", "CO", "CA"}},
      {"es", {"ES", "MX", "AR", "CO", "419", "US", "PR", "CL", "DE", "FR", "PT", "MA"}},
      {"hr", {"HR", "RS", "AT", "DE", "CH"}}};
  int compared = 0;
  for (const std::string& tag : oracle.tags()) {
    EXPECT_EQ(ours({tag}, oracle.tags()), oracle.match({tag})) << tag;
    const std::string language = tag.substr(0, tag.find('-'));
    const auto own = regionsOf.find(language);
    for (const std::string& region : own == regionsOf.end() ? regions : own->second) {
      std::string range = language;
      range += '-';
      range += region;
      // Where a region writes the language in a script its catalogue does not have, ICU rather gives up;
      // a look-up stays with the language.
      const icu::Locale plain(language.c_str());
      icu::Locale likely(range.c_str());
      icu::Locale usual(plain);
      UErrorCode status = U_ZERO_ERROR;
      likely.addLikelySubtags(status);
      usual.addLikelySubtags(status);
      if (language != "zh" && language != "sr" && std::string(likely.getScript()) != usual.getScript())
        continue;
      EXPECT_EQ(ours({range}, oracle.tags()), oracle.match({range})) << range;
      ++compared;
    }
  }
  EXPECT_GT(compared, 2000);
}

TEST(LabelerOracleTest, ListsOfKnownAndUnknownLanguagesMatchAsInIcu) {
  MatcherOracle oracle;
  const Texts unknown{"tlh", "vo", "und-x-a", "cu", "got", "non"};
  RandomTexts random(271828);
  for (int round = 0; round < 5000; ++round) {
    Texts ranges;
    for (std::size_t count = 1 + random.below(4); count > 0; --count) {
      ranges.push_back(random.below(2) == 0 ? random.oneOf(unknown) : random.oneOf(oracle.tags()));
    }
    std::string trace;
    for (const std::string& range : ranges) trace += range + " ";
    ASSERT_EQ(ours(ranges, oracle.tags()), oracle.match(ranges)) << trace;
  }
}

}  // namespace
}  // namespace brenvik
