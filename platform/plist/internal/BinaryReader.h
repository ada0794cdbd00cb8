// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>

#include "platform/plist/PropertyList.h"

namespace brenvik::plist {

// The dictionary key under which a reference of a keyed archive (a "UID") is given; the value is its number.
inline constexpr char kUidKey[] = "CF$UID";

// The value of a whole document; none when it is malformed or beyond a limit. Throws std::bad_alloc.
PropertyList readBinary(std::string_view bytes);

// The value of some objects of a document: those that begin at these offsets in `bytes` (at least one) and
// end with it. The value is the first of them; references count from `first`, which is its number in the
// document, and have `referenceWidth` bytes. Throws std::bad_alloc.
PropertyList readObjects(std::string_view bytes, std::span<const std::uint32_t> offsets, std::size_t first,
                         std::size_t referenceWidth);

}  // namespace brenvik::plist
