// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "platform/messageport/MessagePort.h"
#include "platform/plist/PropertyList.h"

namespace brenvik {

enum class NotificationKind : std::int32_t { updateAvailable = 0, noUpdateRequired = 1, updateFailed = 2 };

// Makes the notification for the telephony daemon about an update check. Only updateAvailable names the
// database, and only if the type has a name. Throws std::bad_alloc.
PropertyList makeNotification(NotificationKind kind, std::int32_t type);

// Sends it, as a binary property list, to the telephony daemon's message port. Never waits; drops it if
// nobody listens.
void sendNotification(MessagePorts& ports, const PropertyList& notification);

}  // namespace brenvik
