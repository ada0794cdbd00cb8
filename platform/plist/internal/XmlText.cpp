// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/XmlText.h"

#include <charconv>
#include <cstdint>
#include <cstring>

#include "platform/base/Utf8.h"

namespace brenvik::plist {
namespace {

bool isXmlCharacter(std::uint32_t c) noexcept {
  if (c < 0x20) return c == '\t' || c == '\n' || c == '\r';
  return c <= 0xD7FF || (c >= 0xE000 && c <= 0xFFFD) || (c >= 0x10000 && c <= 0x10FFFF);
}

void appendUtf8(std::string& to, std::uint32_t c) {
  if (c < 0x80) {
    to.push_back(static_cast<char>(c));
    return;
  }
  if (c < 0x800) {
    to.push_back(static_cast<char>(0xC0 | c >> 6));
  } else {
    if (c < 0x10000) {
      to.push_back(static_cast<char>(0xE0 | c >> 12));
    } else {
      to.push_back(static_cast<char>(0xF0 | c >> 18));
      to.push_back(static_cast<char>(0x80 | (c >> 12 & 0x3F)));
    }
    to.push_back(static_cast<char>(0x80 | (c >> 6 & 0x3F)));
  }
  to.push_back(static_cast<char>(0x80 | (c & 0x3F)));
}

constexpr std::uint64_t kOnes = 0x0101010101010101ULL;
constexpr std::uint64_t kTops = 0x8080808080808080ULL;

// Where plain text stops to be copied as it is: at < & > or a carriage return.
bool stopsText(char c) noexcept { return c == '<' || c == '&' || c == '>' || c == '\r'; }

const char* endOfPlainText(const char* at, const char* end) noexcept {
  auto zeroIn = [](std::uint64_t bytes) { return (bytes - kOnes) & ~bytes; };
  // Eight bytes at a time up to those among which there is a stop. (There may be none after all.)
  while (end - at >= 8) {
    std::uint64_t word;
    std::memcpy(&word, at, sizeof word);
    const std::uint64_t angle = zeroIn((word | kOnes * 2) ^ kOnes * '>');
    if (((angle | zeroIn(word ^ kOnes * '&') | zeroIn(word ^ kOnes * '\r')) & kTops) == 0) {
      at += 8;
      continue;
    }
    for (int i = 0; i < 8; ++i, ++at) {
      if (stopsText(*at)) return at;
    }
  }
  while (at != end && !stopsText(*at)) ++at;
  return at;
}

}  // namespace

bool hasOnlyXmlCharacters(std::string_view bytes) noexcept {
  unsigned char high = 0;
  unsigned char control = 0;
  // No way out in the middle: the compiler turns this into wide instructions.
  for (const char byte : bytes) {
    const auto c = static_cast<unsigned char>(byte);
    high = static_cast<unsigned char>(high | c);
    control = static_cast<unsigned char>(control | ((c < 0x20) & (c != '\t') & (c != '\n') & (c != '\r')));
  }
  if (control != 0) return false;
  if (high < 0x80) return true;
  if (!isValidUtf8(bytes)) return false;
  for (std::size_t at = bytes.find("\xEF\xBF"); at != std::string_view::npos;
       at = bytes.find("\xEF\xBF", at + 3)) {
    if (static_cast<unsigned char>(bytes[at + 2]) >= 0xBE) return false;
  }
  return true;
}

bool XmlText::read(const XmlTag& element, std::string_view* value) {
  const char* from = in_.at();
  in_.moveTo(endOfPlainText(from, in_.end()));
  *value = {from, static_cast<std::size_t>(in_.at() - from)};
  if (in_.startsEndTag()) return in_.endTag(element);
  text_.assign(*value);
  while (!in_.startsEndTag()) {
    if (in_.atEnd() || !markup()) return false;
    from = in_.at();
    in_.moveTo(endOfPlainText(from, in_.end()));
    text_.append(from, in_.at());
  }
  *value = text_;
  return in_.endTag(element);
}

// What stands where plain text stops, the end tag aside.
bool XmlText::markup() {
  const char* const at = in_.at();
  switch (*at) {
    case '&':
      return reference();
    case '\r':
      in_.moveTo(at + 1);
      text_.push_back('\n');
      in_.take('\n');
      return true;
    case '>':
      // The end of a marked section, without one. (An element's tags stand before: there are two bytes.)
      if (at[-1] == ']' && at[-2] == ']') return false;
      in_.moveTo(at + 1);
      text_.push_back('>');
      return true;
    default:
      if (in_.take("<![CDATA[")) return markedSection();
      if (in_.take("<!--")) return in_.comment();
      return in_.take("<?") && in_.instruction();
  }
}

bool XmlText::markedSection() {
  constexpr std::string_view kEnd = "]]>";
  const char* const from = in_.at();
  if (!in_.skipBehind(kEnd)) return false;
  const char* const end = in_.at() - kEnd.size();
  for (const char* at = from; at != end; ++at) {
    if (*at != '\r') {
      text_.push_back(*at);
    } else if (at + 1 == end || at[1] != '\n') {
      text_.push_back('\n');
    }
  }
  return true;
}

bool XmlText::reference() {
  in_.take('&');
  struct Entity {
    std::string_view name;
    char character;
  };
  constexpr Entity kEntities[] = {{"lt;", '<'}, {"gt;", '>'}, {"amp;", '&'}, {"quot;", '"'}, {"apos;", '\''}};
  for (const Entity& entity : kEntities) {
    if (!in_.take(entity.name)) continue;
    text_.push_back(entity.character);
    return true;
  }
  return in_.take('#') && characterReference();
}

bool XmlText::characterReference() {
  const int base = in_.take('x') ? 16 : 10;
  std::uint32_t character = 0;
  const auto [stop, error] = std::from_chars(in_.at(), in_.end(), character, base);
  if (error != std::errc() || !isXmlCharacter(character)) return false;
  in_.moveTo(stop);
  if (!in_.take(';')) return false;
  appendUtf8(text_, character);
  return true;
}

}  // namespace brenvik::plist
