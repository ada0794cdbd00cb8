// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

#include "platform/plist/PropertyList.h"

namespace brenvik {

// Returns the labeler's identifier (platform/labeler/SubscriptionLabeler.h) for one of Brenvik's six label
// keys; no value for any other key. Keys are compared exactly. May throw std::bad_alloc until a call has
// succeeded. Any thread.
PropertyList labelIdentifierForKey(std::string_view key);

}  // namespace brenvik
