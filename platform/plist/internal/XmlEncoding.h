// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace brenvik::plist {

// What the bytes of a document are encoded in, as far as their beginning tells.
enum class XmlEncoding {
  utf8,  // or US-ASCII, if the document declares it
  utf16  // with its byte-order mark
};

XmlEncoding encodingOf(std::string_view bytes) noexcept;

// Whether a document in this encoding may declare this name for it. UTF-16 needs its mark, and its other
// names
// ("UTF-16LE") promise that there is none.
bool mayDeclare(XmlEncoding encoding, std::string_view name) noexcept;

// Whether the declared name promises that every byte is below 0x80.
bool isUsAscii(std::string_view name) noexcept;

// A UTF-16 document as UTF-8, without its mark. Nothing when its bytes are no UTF-16 (a half character or
// half a pair). Throws std::bad_alloc.
std::optional<std::string> utf8OfUtf16(std::string_view bytes);

}  // namespace brenvik::plist
