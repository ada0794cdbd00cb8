// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/lasd/Notifications.h"

#include <gtest/gtest.h>

#include <cstring>

#include "helper/lasd/DatabaseTypes.h"
#include "platform/messageport/fakes/RecordingMessagePorts.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

using Entries = std::vector<std::pair<std::string, PropertyList>>;

PropertyList dictionary(const char* notification, const char* type = nullptr) {
  Entries entries{{"Notification", PropertyList::string(notification)}};
  if (type != nullptr) entries.emplace_back("DBType", PropertyList::string(type));
  return PropertyList::dictionary(entries);
}

TEST(NotificationsTest, AnUpdateNamesItsDatabase) {
  const std::pair<std::int32_t, const char*> types[] = {
      {1, "umts"}, {2, "cdma"}, {4, "lte"}, {8, "gsm"}, {16, "scdma"}};
  for (const auto& [type, name] : types) {
    EXPECT_EQ(makeNotification(NotificationKind::updateAvailable, type),
              dictionary("com.norvale.lasd.UpdateAvailable", name));
  }
}

TEST(NotificationsTest, AnUpdateOfATypeWithoutNameNamesNone) {
  for (const std::int32_t type : {0, 3, 32, -1}) {
    EXPECT_EQ(makeNotification(NotificationKind::updateAvailable, type),
              dictionary("com.norvale.lasd.UpdateAvailable"));
  }
}

TEST(NotificationsTest, NothingToDoAndFailureNameNoDatabaseWhateverTheType) {
  for (const std::int32_t type : {0, 1, 8}) {
    EXPECT_EQ(makeNotification(NotificationKind::noUpdateRequired, type),
              dictionary("com.norvale.lasd.NoUpdateRequired"));
    EXPECT_EQ(makeNotification(NotificationKind::updateFailed, type),
              dictionary("com.norvale.lasd.UpdateFailed"));
  }
}

TEST(NotificationsTest, ANotificationTravelsAsABinaryPropertyListInAMessageWithId0) {
  RecordingMessagePorts ports;
  const auto notification = makeNotification(NotificationKind::updateAvailable, lte);
  sendNotification(ports, notification);
  ASSERT_EQ(ports.messages().size(), 1U);
  const auto message = ports.messages()[0];
  EXPECT_EQ(message.port, "com.norvale.Brenvik.lasd");
  EXPECT_EQ(message.id, 0);
  ASSERT_GE(message.data.size(), 8U);
  EXPECT_EQ(std::memcmp(message.data.data(), "bplist00", 8), 0);
  EXPECT_EQ(parsePropertyList(message.data), notification);
}

TEST(NotificationsTest, WithNobodyListeningOrABusyListenerItIsDropped) {
  RecordingMessagePorts ports;
  ports.nobodyListens = true;
  sendNotification(ports, makeNotification(NotificationKind::updateFailed, 0));
  ports.nobodyListens = false;
  ports.listenerIsBusy = true;
  sendNotification(ports, makeNotification(NotificationKind::updateFailed, 0));
  EXPECT_TRUE(ports.messages().empty());
}

TEST(NotificationsTest, WhatIsNoNotificationIsNotSent) {
  RecordingMessagePorts ports;
  sendNotification(ports, PropertyList());
  EXPECT_TRUE(ports.messages().empty());
}

}  // namespace
}  // namespace brenvik
