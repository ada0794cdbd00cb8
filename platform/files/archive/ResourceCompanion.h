// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace brenvik {

// Returns the extended attributes, name and value, from the beginning of a file's companion: the header
// format of RFC 1740 with an attribute block behind the 32 bytes of entry 9. Leaves out attributes that are
// cut off or have an unusable name; returns none for malformed bytes. Any thread; may throw std::bad_alloc.
std::vector<std::pair<std::string, std::string>> extendedAttributesOf(std::string_view companion);

}  // namespace brenvik
