// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/labels/ChannelRemap.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <array>
#include <cstring>
#include <string>
#include <vector>

#include "platform/contacts/fakes/InMemoryContacts.h"
#include "platform/log/fakes/RecordingLog.h"

namespace brenvik {
namespace {

using ::testing::ElementsAre;

class ChannelRemapTest : public ::testing::Test {
 protected:
  // The reply's boolean; the status is checked on the way.
  int request(const std::string& from, const std::string& to) {
    std::array<char, 64> fromField{};
    std::array<char, 64> toField{};
    std::memcpy(fromField.data(), from.data(), from.size());
    std::memcpy(toField.data(), to.data(), to.size());
    std::uint8_t success = 0xAA;
    EXPECT_EQ(remap.remapContactsChannel(fromField.data(), toField.data(), &success), kern::success);
    return success;
  }
  static RecordingLog::Entry line(std::string text) {
    return RecordingLog::unifiedLine(LogLevel::standard, std::move(text));
  }

  RecordingLog log;
  InMemoryContacts contacts;
  ChannelRemap remap{contacts};
};

TEST_F(ChannelRemapTest, ReferencesFollowTheChannel) {
  contacts.references = {{1, "old"}, {2, "other"}, {3, "old"}};
  EXPECT_EQ(request("old", "new"), 1);
  EXPECT_THAT(contacts.references,
              ElementsAre(InMemoryContacts::Reference{1, "new"}, InMemoryContacts::Reference{2, "other"},
                          InMemoryContacts::Reference{3, "new"}));
  EXPECT_THAT(log.entries(), ElementsAre(line("remapChannelIdentifier old -> new"),
                                         line("remapChannelIdentifier result: success : (none)")));
}

TEST_F(ChannelRemapTest, WithoutMemoryForAManagerTheRemapHasFailed) {
  contacts.exhausted = true;
  EXPECT_EQ(request("old", "new"), 0);
  EXPECT_THAT(log.entries(), ElementsAre(line("remapChannelIdentifier old -> new"),
                                         line("remapChannelIdentifier result: failure : out of memory")));
}

TEST_F(ChannelRemapTest, WhenTheManagerCannotBeCreatedThereIsOneErrorLineAndTheBooleanIsTrue) {
  contacts.isReachable = false;
  EXPECT_EQ(request("old", "new"), 1);
  EXPECT_TRUE(contacts.remaps.empty());
  EXPECT_THAT(log.entries(), ElementsAre(line("remapChannelIdentifier old -> new"),
                                         RecordingLog::unifiedLine(
                                             LogLevel::error, "unable to create ContactsChannelManager")));
}

TEST_F(ChannelRemapTest, AFailedRemapIsLoggedWithItsDescriptionAndTheBooleanIsFalseWithStatusZero) {
  contacts.failWith = "database is locked";
  EXPECT_EQ(request("old", "new"), 0);
  EXPECT_THAT(log.entries(),
              ElementsAre(line("remapChannelIdentifier old -> new"),
                          line("remapChannelIdentifier result: failure : database is locked")));
}

TEST_F(ChannelRemapTest, EachRequestMakesAManagerAnew) {
  EXPECT_EQ(request("a", "b"), 1);
  EXPECT_EQ(request("b", "c"), 1);
  EXPECT_EQ(contacts.managersAsked, 2);
}

TEST_F(ChannelRemapTest, FieldsWithoutATerminatorAreReadToTheirEndAndNoFurther) {
  const std::string from(64, 'f');
  const std::string to(64, 't');
  EXPECT_EQ(request(from, to), 1);
  ASSERT_EQ(contacts.remaps.size(), 1U);
  EXPECT_EQ(contacts.remaps[0], std::pair(from, to));
  EXPECT_EQ(log.entries()[0], line("remapChannelIdentifier " + from + " -> " + to));
}

TEST_F(ChannelRemapTest, WhatFollowsATerminatorIsNotRead) {
  EXPECT_EQ(request(std::string("old\0junk", 8), std::string("\0junk", 5)), 1);
  ASSERT_EQ(contacts.remaps.size(), 1U);
  EXPECT_EQ(contacts.remaps[0], std::pair(std::string("old"), std::string()));
}

TEST_F(ChannelRemapTest, ATextThatIsNotUtf8IsAFailedRemapAndStillStatusZero) {
  EXPECT_EQ(request("\xFF", "new"), 0);
  EXPECT_EQ(log.entries()[1], line("remapChannelIdentifier result: failure : not UTF-8"));
}

}  // namespace
}  // namespace brenvik
