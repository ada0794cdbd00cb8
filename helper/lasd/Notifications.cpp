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
  // A dictionary leaves out what has no value: without memory there is none, rather than half of one.
  std::vector<std::pair<std::string, PropertyList>> entries;
  const auto add = [&entries](const char* key, const char* text) {
    PropertyList value = PropertyList::string(text);
    if (!value) return false;
    entries.emplace_back(key, std::move(value));
    return true;
  };
  if (!add("Notification", valueOf(kind))) return {};
  const char* const key = keyOfDatabaseType(type);
  if (kind == NotificationKind::updateAvailable && key != nullptr && !add("DBType", key)) return {};
  return PropertyList::dictionary(std::move(entries));
}

void sendNotification(MessagePorts& ports, const PropertyList& notification) {
  const auto bytes = serializePropertyList(notification, PropertyListFormat::binary);
  if (!bytes) return;
  const auto port = ports.openRemote(kPortName);
  if (port == nullptr) return;
  (void)port->send(kMessageId, std::as_bytes(std::span(*bytes)));  // dropped without a word, by design
}

}  // namespace brenvik
