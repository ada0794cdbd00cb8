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
inline constexpr std::size_t kMaxPropertyListDepth = 512;               // nesting levels
inline constexpr std::size_t kLargestXmlForm = std::size_t{64} << 20;  // bytes a document may have as XML

enum class PropertyListFormat { xml, binary };

// Why there is no result.
enum class CodecFailure {
  none,      // there is one
  refused,   // the document is malformed, beyond a limit, or cannot be said in the format
  noMemory,  // which tells nothing about the document
};

// Parses a whole document of either format (told apart by its first bytes). No value when it is malformed or
// beyond a limit, or when memory runs out; *why, where given, tells. The bytes are only read during the call.
// Any thread; throws nothing.
PropertyList parsePropertyList(std::span<const std::byte> bytes, CodecFailure* why = nullptr) noexcept;

// The document as XML (version 1.0, with the usual document type) or in the binary version 00 format.
// Nothing when there is no value, when it is beyond a limit or holds what the format cannot say, or when
// memory runs out.
std::optional<std::string> serializePropertyList(const PropertyList& value, PropertyListFormat format,
                                                 CodecFailure* why = nullptr) noexcept;

}  // namespace brenvik
