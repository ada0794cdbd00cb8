// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/XmlMarkup.h"

#include <algorithm>

#include "platform/plist/internal/Text.h"

namespace brenvik::plist {
namespace {

bool isDigit(char c) noexcept { return c >= '0' && c <= '9'; }
bool isLetter(char c) noexcept { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }

// Production 13 of XML 1.0.
bool isPublicIdCharacter(char c) noexcept {
  return isLetter(c) || isDigit(c) ||
         std::string_view(" \r\n-'()+,./:=?;!*#@$_%").find(c) != std::string_view::npos;
}

// Names that are reserved for XML itself, in any case.
bool isReservedTarget(std::string_view target) noexcept {
  return target.size() == 3 && (target[0] | 0x20) == 'x' && (target[1] | 0x20) == 'm' &&
         (target[2] | 0x20) == 'l';
}

}  // namespace

bool XmlMarkup::skipBehind(std::string_view mark) noexcept {
  const std::size_t found = std::string_view(at_, left()).find(mark);
  if (found == std::string_view::npos) return false;
  at_ += found + mark.size();
  return true;
}

bool XmlMarkup::literal(std::string_view* value) noexcept {
  if (atEnd() || (*at_ != '"' && *at_ != '\'')) return false;
  const char quote = *at_++;
  const char* const from = at_;
  while (at_ != end_ && *at_ != quote) ++at_;
  *value = {from, static_cast<std::size_t>(at_ - from)};
  return take(quote);
}

bool XmlMarkup::pseudoAttribute(std::string_view name, std::string_view* value) noexcept {
  if (!take(name)) return false;
  space();
  if (!take('=')) return false;
  space();
  return literal(value);
}

bool XmlMarkup::declaration(XmlEncoding encoding) noexcept {
  if (left() < 6 || std::memcmp(at_, "<?xml", 5) != 0 || !isXmlSpace(at_[5])) return true;
  at_ += 5;
  std::string_view value;
  space();
  if (!pseudoAttribute("version", &value) || value != "1.0") return false;
  bool spaced = space();
  if (spaced && !atEnd() && *at_ == 'e') {
    if (!pseudoAttribute("encoding", &value) || !mayDeclare(encoding, value)) return false;
    if (isUsAscii(value) && !isAscii(at_, left())) return false;
    spaced = space();
  }
  if (spaced && !atEnd() && *at_ == 's') {
    if (!pseudoAttribute("standalone", &value) || (value != "yes" && value != "no")) return false;
    space();
  }
  return take("?>");
}

bool XmlMarkup::instruction() noexcept {
  const char* const from = at_;
  const auto continues = [&](char c) {
    return isLetter(c) || c == '_' || (at_ != from && (isDigit(c) || c == '-' || c == '.'));
  };
  while (at_ != end_ && continues(*at_)) ++at_;
  const std::string_view target(from, static_cast<std::size_t>(at_ - from));
  if (target.empty() || isReservedTarget(target)) return false;
  return take("?>") || (space() && skipBehind("?>"));
}

bool XmlMarkup::misc() noexcept {
  while (true) {
    space();
    if (left() < 2 || at_[0] != '<') return true;
    if (at_[1] == '?') {
      at_ += 2;
      if (!instruction()) return false;
    } else if (take("<!--")) {
      if (!comment()) return false;
    } else {
      return true;
    }
  }
}

// Behind white space; true when there is none.
bool XmlMarkup::externalId() noexcept {
  std::string_view value;
  if (take("PUBLIC")) {
    if (!space() || !literal(&value) || !std::ranges::all_of(value, isPublicIdCharacter)) return false;
    return space() && literal(&value);
  }
  return !take("SYSTEM") || (space() && literal(&value));
}

bool XmlMarkup::documentType() noexcept {
  if (!take("<!DOCTYPE")) return true;
  if (!space() || !take("plist")) return false;
  if (space() && !externalId()) return false;
  space();
  return take('>');
}

bool XmlMarkup::rootTag() noexcept {
  if (!take("<plist")) return false;
  if (space() && !atEnd() && *at_ == 'v') {
    std::string_view value;
    if (!pseudoAttribute("version", &value) || value.find_first_of("<&") != std::string_view::npos)
      return false;
    space();
  }
  return take('>');
}

bool XmlMarkup::spacedEndTag(std::string_view name) noexcept {
  if (!take("</") || !take(name)) return false;
  space();
  return take('>');
}

}  // namespace brenvik::plist
