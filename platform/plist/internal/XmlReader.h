// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

#include "platform/plist/PropertyList.h"

namespace brenvik::plist {

// Reads the property-list grammar (XML 1.0 in UTF-8, in US-ASCII where declared, or in UTF-16 with its
// byte-order mark) and nothing more of XML: no internal document type, no
// entity but the predefined five, nothing is ever fetched. Every document it takes is well-formed.
// Throws std::bad_alloc.
PropertyList readXml(std::string_view bytes);

}  // namespace brenvik::plist
