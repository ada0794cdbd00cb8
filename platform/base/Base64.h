// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <string_view>

// Base64 as RFC 4648, section 4, defines it, with padding. Any thread; nothing here allocates.
namespace brenvik {

// The number of base64 characters that this many bytes encode to.
constexpr std::size_t base64Size(std::size_t bytes) noexcept { return (bytes + 2) / 3 * 4; }

// Writes base64Size(size) characters, without line ends or NUL, and returns the end of what it wrote.
char* encodeBase64(const char* bytes, std::size_t size, char* to) noexcept;

// The most bytes that decodeBase64() writes for a text of this many characters.
constexpr std::size_t base64DecodedRoom(std::size_t characters) noexcept { return characters / 4 * 3 + 3; }

// Writes the decoded bytes and returns the end of what it wrote, or null if the text is not base64.
// Spaces, tabs and line ends are skipped anywhere.
char* decodeBase64(std::string_view text, char* to) noexcept;

}  // namespace brenvik
