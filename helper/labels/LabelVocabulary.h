// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

#include "platform/plist/PropertyList.h"

namespace brenvik {

// The labeler's identifier (platform/labeler/SubscriptionLabeler.h) for one of Brenvik's six label keys, or
// no value when the key is none of them. Keys are compared exactly. The first call may throw std::bad_alloc;
// the next one then is the first again. Any thread.
PropertyList labelIdentifierForKey(std::string_view key);

}  // namespace brenvik
