// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <optional>
#include <span>
#include <string>

#include "platform/plist/PropertyList.h"

namespace brenvik {

// Limits of every reader; a document beyond one of them is refused as malformed, in bounded time and memory.
inline constexpr std::size_t kMaxPropertyListDepth = 512;              // nesting levels
inline constexpr std::size_t kLargestXmlForm = std::size_t{64} << 20;  // bytes a document may have as XML

enum class PropertyListFormat { xml, binary };

// Both functions: any thread; throw std::bad_alloc when memory runs out, which tells nothing about the
// document, and nothing else.

// Parses a whole document of either format (told apart by its first bytes). No value when it is malformed or
// beyond a limit. The bytes are only read during the call.
PropertyList parsePropertyList(std::span<const std::byte> bytes);

// The document as XML (version 1.0, with the usual document type) or in the binary version 00 format. Nothing
// when there is no value, or when it is beyond a limit or holds what the format cannot say.
std::optional<std::string> serializePropertyList(const PropertyList& value, PropertyListFormat format);

}  // namespace brenvik
