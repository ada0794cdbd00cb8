// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "platform/messageport/MessagePort.h"
#include "platform/plist/PropertyList.h"

namespace brenvik {

enum class NotificationKind : std::int32_t { updateAvailable = 0, noUpdateRequired = 1, updateFailed = 2 };

// What the telephony daemon is told of an update check. Only updateAvailable says which database; a type that
// has no name is left out there too.
PropertyList makeNotification(NotificationKind kind, std::int32_t type);

// Sends it, as a binary property list, to the telephony daemon's message port. Waits for nothing; when nobody
// listens it is dropped.
void sendNotification(MessagePorts& ports, const PropertyList& notification);

}  // namespace brenvik
