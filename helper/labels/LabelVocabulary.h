// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

#include "platform/plist/PropertyList.h"

namespace brenvik {

// The labeler's identifier (platform/labeler/SubscriptionLabeler.h) for one of Brenvik's six label keys, or
// no value when the key is none of them. Keys are compared exactly. Where memory for the table runs out there
// is no value either, and the next call tries again. Any thread.
PropertyList labelIdentifierForKey(std::string_view key) noexcept;

}  // namespace brenvik
