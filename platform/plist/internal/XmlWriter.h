// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>

#include "platform/plist/Node.h"
#include "platform/plist/internal/XmlSize.h"

namespace brenvik::plist {

// Nothing when beyond a limit or when XML cannot carry a character or a date. Throws std::bad_alloc.
std::optional<std::string> writeXml(const Node& root);

// Exact, for what writeXml() can write: a value that is no container, or an empty one; a key.
XmlExtent xmlExtentOf(const Node& node) noexcept;
XmlExtent xmlExtentOfKey(const Node& key) noexcept;

}  // namespace brenvik::plist
