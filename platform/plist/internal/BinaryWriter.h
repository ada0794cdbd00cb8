// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>

#include "platform/plist/Node.h"

// Internal to this folder.
namespace brenvik::plist {

// Equal scalars are written once, and so are shared containers. Nothing when beyond a limit.
// Throws std::bad_alloc.
std::optional<std::string> writeBinary(const Node& root);

}  // namespace brenvik::plist
