// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string_view>

#include "platform/plist/PropertyList.h"

// Internal to this folder.
namespace brenvik::plist {

inline constexpr std::string_view kBinaryMagic = "bplist00";
inline constexpr std::size_t kBinaryTrailer = 32;

// The dictionary key under which a reference of a keyed archive (a "UID") is given; the value is its number.
inline constexpr char kUidKey[] = "CF$UID";

// Throws std::bad_alloc.
PropertyList readBinary(std::string_view bytes);

}  // namespace brenvik::plist
