// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <string_view>

namespace brenvik {

// True when the bytes are well-formed UTF-8 (RFC 3629: shortest form, no surrogates, at most U+10FFFF).
// A NUL byte is well-formed. Any thread; allocates nothing.
bool isValidUtf8(std::string_view bytes) noexcept;

// Returns the length in bytes, 1 to 4, of the first character; 0 if it is not well-formed, or if there are no
// bytes. Any thread; allocates nothing.
std::size_t utf8CharacterLength(std::string_view bytes) noexcept;

// The text of a fixed-size message field: everything before its first NUL, or the whole field.
std::string_view textOfField(const char* field, std::size_t size) noexcept;

}  // namespace brenvik
