// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/XmlEncoding.h"

#include <algorithm>

#include "platform/plist/internal/Text.h"

namespace brenvik::plist {
namespace {

constexpr std::string_view kLittleEndianMark = "\xFF\xFE";
constexpr std::string_view kBigEndianMark = "\xFE\xFF";

// Encoding names are compared without case.
bool isName(std::string_view name, std::string_view upperCased) noexcept {
  return std::ranges::equal(name, upperCased, [](char given, char wanted) {
    return (given >= 'a' && given <= 'z' ? given - 'a' + 'A' : given) == wanted;
  });
}

}  // namespace

XmlEncoding encodingOf(std::string_view bytes) noexcept {
  const bool hasMark = bytes.starts_with(kLittleEndianMark) || bytes.starts_with(kBigEndianMark);
  return hasMark ? XmlEncoding::utf16 : XmlEncoding::utf8;
}

bool isUsAscii(std::string_view name) noexcept { return isName(name, "US-ASCII"); }

bool mayDeclare(XmlEncoding encoding, std::string_view name) noexcept {
  switch (encoding) {
    case XmlEncoding::utf8:
      return isName(name, "UTF-8") || isUsAscii(name);
    case XmlEncoding::utf16:
      return isName(name, "UTF-16");
  }
  return false;
}

std::optional<std::string> utf8OfUtf16(std::string_view bytes) {
  if (bytes.size() % 2 != 0) return std::nullopt;
  const bool isBigEndian = bytes.starts_with(kBigEndianMark);
  bytes.remove_prefix(kBigEndianMark.size());
  const auto* const from = reinterpret_cast<const unsigned char*>(bytes.data());
  const std::size_t units = bytes.size() / 2;
  std::string text(units * 3, '\0');
  const char* const end = isBigEndian ? utf8FromUtf16<ByteOrder::big>(from, units, text.data())
                                      : utf8FromUtf16<ByteOrder::little>(from, units, text.data());
  if (end == nullptr) return std::nullopt;
  text.resize(static_cast<std::size_t>(end - text.data()));
  return text;
}

}  // namespace brenvik::plist
