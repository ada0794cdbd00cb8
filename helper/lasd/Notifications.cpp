// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/lasd/Notifications.h"

#include <span>
#include <string>
#include <utility>
#include <vector>

#include "helper/lasd/DatabaseTypes.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

constexpr const char kPortName[] = "com.norvale.Brenvik.lasd";
constexpr std::int32_t kMessageId = 0;

const char* valueOf(NotificationKind kind) noexcept {
  switch (kind) {
    case NotificationKind::updateAvailable:
      return "com.norvale.lasd.UpdateAvailable";
    case NotificationKind::noUpdateRequired:
      return "com.norvale.lasd.NoUpdateRequired";
    case NotificationKind::updateFailed:
      return "com.norvale.lasd.UpdateFailed";
  }
  return "";
}

}  // namespace

PropertyList makeNotification(NotificationKind kind, std::int32_t type) {
  std::vector<std::pair<std::string, PropertyList>> entries;
  entries.emplace_back("Notification", PropertyList::string(valueOf(kind)));
  const char* const key = keyOfDatabaseType(type);
  if (kind == NotificationKind::updateAvailable && key != nullptr) {
    entries.emplace_back("DBType", PropertyList::string(key));
  }
  return PropertyList::dictionary(entries);
}

void sendNotification(MessagePorts& ports, const PropertyList& notification) {
  const auto bytes = serializePropertyList(notification, PropertyListFormat::binary);
  if (!bytes) return;
  const auto port = ports.openRemote(kPortName);
  if (port == nullptr) return;
  (void)port->send(kMessageId, std::as_bytes(std::span(*bytes)));  // dropped without a word, by design
}

}  // namespace brenvik
