// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/labels/LabelRoutines.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/ipc/fakes/HeapRegions.h"
#include "platform/labeler/fakes/RecordingLabeler.h"
#include "platform/labeler/linux/CatalogueLabeler.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

using ::testing::ElementsAre;
using Operation = RecordingLabeler::Call::Operation;

PropertyList text(std::string_view utf8) { return PropertyList::string(utf8); }

PropertyList texts(const std::vector<std::string>& all) {
  std::vector<PropertyList> elements;
  for (const std::string& each : all) elements.push_back(text(each));
  return PropertyList::array(std::move(elements));
}

std::string bytesOf(const PropertyList& value, PropertyListFormat format = PropertyListFormat::xml) {
  return serializePropertyList(value, format).value();
}

RecordingLog::Entry standard(std::string line) {
  return RecordingLog::unifiedLine(LogLevel::standard, std::move(line));
}
RecordingLog::Entry error(std::string line) {
  return RecordingLog::unifiedLine(LogLevel::error, std::move(line));
}

const std::string kBusiness(label_identifier::business);
const std::string kPrimary(label_identifier::primary);

// Both routines, told apart by their names: what they share is tested for each.
struct Routine {
  const char* name;
  const char* compiling;
  KernelReturn (LabelRoutines::*call)(const void*, std::uint32_t, const void*, std::uint32_t,
                                      OutOfLinePayload*) noexcept;
};
constexpr Routine kBadges{"CopyBadgeLabels", "compiling badge labels", &LabelRoutines::copyBadgeLabels};
constexpr Routine kNames{"CopyLocalizedLabels", "compiling localized labels",
                         &LabelRoutines::copyLocalizedLabels};

class LabelRoutinesTest : public ::testing::TestWithParam<Routine> {
 protected:
  KernelReturn call(const Routine& routine, const std::string& labels, const std::string& languages) {
    payload = {this, 0xAAAAAAAA};  // to be overwritten in any case
    return (routines.*routine.call)(labels.data(), static_cast<std::uint32_t>(labels.size()),
                                    languages.data(), static_cast<std::uint32_t>(languages.size()), &payload);
  }
  KernelReturn call(const Routine& routine, const PropertyList& labels, const PropertyList& languages) {
    return call(routine, bytesOf(labels), bytesOf(languages));
  }
  void expectNoPayload() const {
    EXPECT_EQ(payload.address, nullptr);
    EXPECT_EQ(payload.length, 0U);
    EXPECT_EQ(regions.live(), 0U);
  }
  std::string payloadBytes() const { return {static_cast<const char*>(payload.address), payload.length}; }
  RecordingLog::Entry compiling(const Routine& routine, std::size_t labels, std::size_t languages) const {
    return standard(std::string(routine.name) + ", " + routine.compiling + ". labels len:" +
                    std::to_string(labels) + ", languages len:" + std::to_string(languages));
  }
  RecordingLog::Entry failure(const Routine& routine, const std::string& problem) const {
    return error(std::string(routine.name) + ", " + problem);
  }

  RecordingLog log;
  HeapRegions regions;
  RecordingLabeler labeler;
  LabelRoutines routines{labeler, regions};
  OutOfLinePayload payload;
};

INSTANTIATE_TEST_SUITE_P(Both, LabelRoutinesTest, ::testing::Values(kBadges, kNames),
                         [](const auto& routine) { return std::string(routine.param.name); });

// ---- What both share: decoding, serializing, allocating. ----

TEST_P(LabelRoutinesTest, LabelBytesThatAreNotThereCannotBeDecoded) {
  const std::string languages = bytesOf(texts({}));
  payload = {this, 7};
  EXPECT_EQ((routines.*GetParam().call)(nullptr, 5, languages.data(),
                                        static_cast<std::uint32_t>(languages.size()), &payload),
            kern::failure);
  EXPECT_THAT(log.entries(), ElementsAre(compiling(GetParam(), 5, languages.size()),
                                         failure(GetParam(), "cannot decode 'labels' field")));
  expectNoPayload();
}

TEST_P(LabelRoutinesTest, LabelBytesThatAreNoPropertyListCannotBeBuilt) {
  for (const std::string bytes : {"", "x", "bplist00", "<plist>"}) {
    log.clear();
    EXPECT_EQ(call(GetParam(), bytes, bytesOf(texts({}))), kern::failure);
    EXPECT_THAT(log.entries(), ElementsAre(compiling(GetParam(), bytes.size(), bytesOf(texts({})).size()),
                                           failure(GetParam(), "cannot build labels from data")));
    expectNoPayload();
  }
}

TEST_P(LabelRoutinesTest, AnEmptyRegionWithoutAnAddressIsNoPropertyListEither) {
  EXPECT_EQ((routines.*GetParam().call)(nullptr, 0, nullptr, 0, &payload), kern::failure);
  EXPECT_THAT(log.entries(),
              ElementsAre(compiling(GetParam(), 0, 0), failure(GetParam(), "cannot build labels from data")));
  expectNoPayload();
}

TEST_P(LabelRoutinesTest, LabelsThatAreNoArrayAreOfAnInvalidType) {
  for (const PropertyList& value : {PropertyList::dictionary({{"a", text("b")}}), text("USER_LABEL_PRIMARY"),
                                    PropertyList::integer(1), PropertyList::data({})}) {
    log.clear();
    EXPECT_EQ(call(GetParam(), value, texts({"en"})), kern::failure);
    EXPECT_EQ(log.entries().size(), 2U);
    EXPECT_EQ(log.entries().back(), failure(GetParam(), "invalid type of 'labels' field"));
    expectNoPayload();
  }
}

TEST_P(LabelRoutinesTest, LanguageBytesThatAreNotThereCannotBeDecoded) {
  const std::string labels = bytesOf(texts({"USER_LABEL_PRIMARY", ""}));
  EXPECT_EQ((routines.*GetParam().call)(labels.data(), static_cast<std::uint32_t>(labels.size()), nullptr, 9,
                                        &payload),
            kern::failure);
  EXPECT_THAT(log.entries(), ElementsAre(compiling(GetParam(), labels.size(), 9),
                                         failure(GetParam(), "cannot decode 'languages' field")));
  expectNoPayload();
}

TEST_P(LabelRoutinesTest, LanguageBytesThatAreNoPropertyListCannotBeBuilt) {
  EXPECT_EQ(call(GetParam(), bytesOf(texts({"USER_LABEL_PRIMARY", ""})), "en"), kern::failure);
  EXPECT_EQ(log.entries().size(), 2U);
  EXPECT_EQ(log.entries().back(), failure(GetParam(), "cannot build languages from data"));
  expectNoPayload();
}

TEST_P(LabelRoutinesTest, ALanguagesPayloadThatDecodesToADictionaryIsOfAnInvalidType) {
  EXPECT_EQ(
      call(GetParam(), texts({"USER_LABEL_PRIMARY", ""}), PropertyList::dictionary({{"en", text("de")}})),
      kern::failure);
  EXPECT_EQ(log.entries().size(), 2U);
  EXPECT_EQ(log.entries().back(), failure(GetParam(), "invalid type of 'languages' field"));
  EXPECT_TRUE(labeler.calls.empty());
  expectNoPayload();
}

TEST_P(LabelRoutinesTest, LabelsAreLookedAtBeforeLanguages) {
  EXPECT_EQ(call(GetParam(), "x", "y"), kern::failure);
  EXPECT_EQ(log.entries().size(), 2U);
  EXPECT_EQ(log.entries().back(), failure(GetParam(), "cannot build labels from data"));
}

TEST_P(LabelRoutinesTest, TheAnswerIsHandedOverAsXmlByteForByte) {
  labeler.answer = texts({"Ä & <B>", ""});
  EXPECT_EQ(call(GetParam(), texts({"USER_LABEL_PRIMARY", ""}), texts({"de"})), kern::success);
  EXPECT_EQ(payloadBytes(), bytesOf(*labeler.answer, PropertyListFormat::xml));
  EXPECT_EQ(regions.lastLength, payload.length);
  regions.deallocate(payload.address, payload.length);
}

TEST_P(LabelRoutinesTest, BinaryRequestsAreAsGoodAsXmlOnes) {
  EXPECT_EQ(call(GetParam(), bytesOf(texts({"USER_LABEL_PRIMARY", ""}), PropertyListFormat::binary),
                 bytesOf(texts({"de"}), PropertyListFormat::binary)),
            kern::success);
  EXPECT_EQ(payloadBytes(), bytesOf(texts({kPrimary}), PropertyListFormat::xml));
  regions.deallocate(payload.address, payload.length);
}

TEST_P(LabelRoutinesTest, AnAbsentAnswerFailsWithoutAFurtherLine) {
  labeler.answer = PropertyList();
  EXPECT_EQ(call(GetParam(), texts({"USER_LABEL_PRIMARY", ""}), texts({"de"})), kern::failure);
  EXPECT_EQ(log.entries().size(), 2U);
  expectNoPayload();
}

TEST_P(LabelRoutinesTest, AnAnswerThatXmlCannotSayFailsWithoutAFurtherLine) {
  labeler.answer = texts({std::string("\0", 1)});
  EXPECT_EQ(call(GetParam(), texts({"USER_LABEL_PRIMARY", ""}), texts({"de"})), kern::failure);
  EXPECT_EQ(log.entries().size(), 2U);
  EXPECT_EQ(regions.calls, 0);
  expectNoPayload();
}

TEST_P(LabelRoutinesTest, ARefusedAllocationIsLoggedWithItsLengthAndItsCodeReturnedWithoutALength) {
  regions.refuseWith = kern::noSpace;
  labeler.answer = texts({"B"});
  EXPECT_EQ(call(GetParam(), texts({"USER_LABEL_BUSINESS", ""}), texts({"en"})), kern::noSpace);
  const std::size_t length = bytesOf(*labeler.answer).size();
  EXPECT_EQ(log.entries().back(),
            failure(GetParam(), "Could not allocate " + std::to_string(length) + " bytes for payload"));
  expectNoPayload();
}

// ---- Badges: pairs of a key and a text. ----

class BadgeLabelsTest : public LabelRoutinesTest {
 protected:
  // The labels that reach the labeler; nothing when it is not asked.
  std::vector<PropertyList> labelsFor(std::vector<PropertyList> elements) {
    labeler.calls.clear();
    const PropertyList languages = texts({"de", "en"});
    const KernelReturn code = call(kBadges, PropertyList::array(std::move(elements)), languages);
    if (labeler.calls.empty()) {
      EXPECT_EQ(code, kern::failure);
      expectNoPayload();
      return {};
    }
    EXPECT_EQ(code, kern::success);
    regions.deallocate(payload.address, payload.length);
    EXPECT_EQ(labeler.calls.size(), 1U);
    EXPECT_EQ(labeler.calls[0].operation, Operation::badges);
    EXPECT_EQ(labeler.calls[0].languages, languages);
    std::vector<PropertyList> labels;
    for (std::size_t i = 0; i < labeler.calls[0].labels.size(); ++i)
      labels.push_back(labeler.calls[0].labels.at(i));
    EXPECT_EQ(log.entries().back(), standard("getLocalizedBadgeLabelsForUnlocalizedLabels, " +
                                             std::to_string(labels.size()) + " label(s)"));
    return labels;
  }
};

TEST_F(BadgeLabelsTest, AKeyWithAnyTextAndAnEmptyKeyWithAUsersTextGiveTheIdentifierAndTheUsersText) {
  EXPECT_THAT(labelsFor({text("USER_LABEL_BUSINESS"), text("never looked at"), text(""), text("My own")}),
              ElementsAre(text(kBusiness), text("My own")));
}

TEST_F(BadgeLabelsTest, TheTextOfAKeyIsNotLookedAtWhateverItIs) {
  EXPECT_THAT(labelsFor({text("USER_LABEL_BUSINESS"), PropertyList::integer(5), text("USER_LABEL_PRIMARY"),
                         text("")}),
              ElementsAre(text(kBusiness), text(kPrimary)));
}

TEST_F(BadgeLabelsTest, AFirstElementThatIsANumberEndsTheWalkWithNoLabels) {
  EXPECT_THAT(labelsFor({PropertyList::integer(1), text("a"), text("USER_LABEL_BUSINESS"), text("b")}),
              ElementsAre());
  ASSERT_EQ(log.entries().size(), 3U);
  EXPECT_EQ(log.entries()[1], error("invalid object in array - ignore the rest"));
  EXPECT_EQ(log.entries()[2], error("no labels given"));
}

TEST_F(BadgeLabelsTest, ALaterKeyThatIsNoTextEndsTheWalkAndKeepsWhatWasGathered) {
  EXPECT_THAT(labelsFor({text("USER_LABEL_BUSINESS"), text("a"), PropertyList::boolean(true), text("b"),
                         text("USER_LABEL_PRIMARY"), text("c")}),
              ElementsAre(text(kBusiness)));
  ASSERT_EQ(log.entries().size(), 3U);
  EXPECT_EQ(log.entries()[1], error("invalid object in array - ignore the rest"));
}

TEST_F(BadgeLabelsTest, AnOddListEndingInAnEmptyKeyUsesOnlyTheEarlierLabels) {
  EXPECT_THAT(labelsFor({text("USER_LABEL_BUSINESS"), text("a"), text("")}), ElementsAre(text(kBusiness)));
  EXPECT_THAT(labelsFor({text("")}), ElementsAre());
  EXPECT_EQ(log.entries().back(), error("no labels given"));
}

TEST_F(BadgeLabelsTest, AnOddListEndingInAKeyUsesThatKey) {
  EXPECT_THAT(labelsFor({text("USER_LABEL_BUSINESS")}), ElementsAre(text(kBusiness)));
}

TEST_F(BadgeLabelsTest, AUsersTextIsPassedOnWithoutACheckOfItsTypeAndTheWalkGoesOn) {
  const PropertyList number = PropertyList::integer(3);
  EXPECT_THAT(labelsFor({text(""), number, text(""), text("x")}), ElementsAre(number, text("x")));
}

TEST_F(BadgeLabelsTest, AnEmptyUsersTextIsALabel) {
  EXPECT_THAT(labelsFor({text(""), text(""), text(""), text("x")}), ElementsAre(text(""), text("x")));
}

TEST_F(BadgeLabelsTest, AnUnknownKeyIsSkippedTogetherWithItsText) {
  EXPECT_THAT(labelsFor({text("USER_LABEL_HOLIDAY"), text("a"), text("USER_LABEL_BUSINESS"), text("b")}),
              ElementsAre(text(kBusiness)));
  EXPECT_THAT(labelsFor({text("user_label_business"), text("a")}), ElementsAre());
  EXPECT_EQ(log.entries().back(), error("no labels given"));
}

TEST_F(BadgeLabelsTest, AnEmptyListGivesNoLabels) {
  EXPECT_THAT(labelsFor({}), ElementsAre());
  ASSERT_EQ(log.entries().size(), 2U);
  EXPECT_EQ(log.entries()[1], error("no labels given"));
}

TEST_F(BadgeLabelsTest, AnEmptyListOfLanguagesIsPassedOnAsItIs) {
  EXPECT_EQ(call(kBadges, texts({"", "x"}), texts({})), kern::success);
  EXPECT_TRUE(labeler.calls[0].languages.is(PropertyList::Type::array));
  regions.deallocate(payload.address, payload.length);
}

// ---- Names: keys alone. ----

class LocalizedLabelsTest : public LabelRoutinesTest {};

TEST_F(LocalizedLabelsTest, KeysBecomeIdentifiersInTheirOrder) {
  EXPECT_EQ(call(kNames, texts({"USER_LABEL_BUSINESS", "USER_LABEL_PRIMARY", "USER_LABEL_BUSINESS"}),
                 texts({"de", "en"})),
            kern::success);
  ASSERT_EQ(labeler.calls.size(), 1U);
  EXPECT_EQ(labeler.calls[0].operation, Operation::names);
  EXPECT_EQ(labeler.calls[0].labels, texts({kBusiness, kPrimary, kBusiness}));
  EXPECT_EQ(labeler.calls[0].languages, texts({"de", "en"}));
  ASSERT_EQ(log.entries().size(), 2U);
  EXPECT_EQ(log.entries()[1], standard("getLocalizedPredefinedLabels, 3 label(s), 2 language(s)"));
  regions.deallocate(payload.address, payload.length);
}

TEST_F(LocalizedLabelsTest, UnknownKeysAndElementsThatAreNoTextsAreSkippedButCounted) {
  EXPECT_EQ(call(kNames,
                 PropertyList::array({text("USER_LABEL_HOLIDAY"), PropertyList::integer(1), text(""),
                                      text("USER_LABEL_PRIMARY"),
                                      PropertyList::array({text("USER_LABEL_TRAVEL")})}),
                 texts({"en"})),
            kern::success);
  EXPECT_EQ(labeler.calls[0].labels, texts({kPrimary}));
  EXPECT_EQ(log.entries()[1], standard("getLocalizedPredefinedLabels, 5 label(s), 1 language(s)"));
  regions.deallocate(payload.address, payload.length);
}

TEST_F(LocalizedLabelsTest, AnEmptyListOfLabelsGoesToTheLabelerAndIsNoError) {
  EXPECT_EQ(call(kNames, texts({}), texts({"en"})), kern::success);
  EXPECT_EQ(labeler.calls[0].labels, texts({}));
  ASSERT_EQ(log.entries().size(), 2U);
  EXPECT_EQ(log.entries()[1], standard("getLocalizedPredefinedLabels, 0 label(s), 1 language(s)"));
  EXPECT_EQ(payloadBytes(), bytesOf(texts({})));
  regions.deallocate(payload.address, payload.length);
}

TEST_F(LocalizedLabelsTest, AnEmptyListOfLanguagesMeansNoLanguages) {
  EXPECT_EQ(call(kNames, texts({"USER_LABEL_PRIMARY"}), texts({})), kern::success);
  EXPECT_FALSE(labeler.calls[0].languages.hasValue());
  regions.deallocate(payload.address, payload.length);
}

// ---- With the real labeler. ----

class RealLabelsTest : public ::testing::Test {
 protected:
  std::string request(bool badges, const PropertyList& labels, const PropertyList& languages) {
    const std::string labelBytes = bytesOf(labels);
    const std::string languageBytes = bytesOf(languages);
    OutOfLinePayload payload;
    const auto method = badges ? &LabelRoutines::copyBadgeLabels : &LabelRoutines::copyLocalizedLabels;
    EXPECT_EQ(
        (routines.*method)(labelBytes.data(), static_cast<std::uint32_t>(labelBytes.size()),
                           languageBytes.data(), static_cast<std::uint32_t>(languageBytes.size()), &payload),
        kern::success);
    const PropertyList answer =
        parsePropertyList({static_cast<const std::byte*>(payload.address), payload.length});
    std::string joined;
    for (std::size_t i = 0; i < answer.size(); ++i) {
      if (i != 0) joined += '|';
      joined += answer.at(i).asString().value();
    }
    regions.deallocate(payload.address, payload.length);
    return joined;
  }

  HeapRegions regions;
  CatalogueLabeler labeler;
  LabelRoutines routines{labeler, regions};
};

TEST_F(RealLabelsTest, TheSixLabelsComeBackInTheUsersLanguage) {
  const PropertyList six = texts({"USER_LABEL_PRIMARY", "USER_LABEL_SECONDARY", "USER_LABEL_PERSONAL",
                                  "USER_LABEL_BUSINESS", "USER_LABEL_TRAVEL", "USER_LABEL_CELL_DATA"});
  EXPECT_EQ(request(false, six, texts({"zh-Hant-TW"})), "主要|次要|個人|公司|旅行|行動數據");
  EXPECT_EQ(request(false, six, texts({})), "Primary|Secondary|Personal|Business|Travel|Cellular Data");
}

TEST_F(RealLabelsTest, BadgesOfKeysAndOwnTextsAreMadeTogether) {
  EXPECT_EQ(request(true, texts({"USER_LABEL_BUSINESS", "x", "", "ışık", "", "iş", "", "İstanbul"}),
                    texts({"tr-TR"})),
            "İ|I|İŞ|İS");
}

}  // namespace
}  // namespace brenvik
