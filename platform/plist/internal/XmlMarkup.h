// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstring>
#include <string_view>

#include "platform/plist/internal/XmlEncoding.h"

namespace brenvik::plist {

inline bool isXmlSpace(char c) noexcept { return c == ' ' || c == '\n' || c == '\t' || c == '\r'; }

struct XmlTag {
  std::string_view name;
  std::string_view end;  // the usual end tag, without white space
};

// A place in an XML document, and the markup that can stand there. The document outlives the object. Each
// function that reads a piece of markup moves behind it; when it returns false, the document is malformed and
// the place means nothing any more. Nothing here allocates.
class XmlMarkup {
 public:
  explicit XmlMarkup(std::string_view bytes) noexcept : at_(bytes.data()), end_(at_ + bytes.size()) {}

  const char* at() const noexcept { return at_; }
  const char* end() const noexcept { return end_; }
  bool atEnd() const noexcept { return at_ == end_; }
  std::size_t left() const noexcept { return static_cast<std::size_t>(end_ - at_); }
  void moveTo(const char* place) noexcept { at_ = place; }
  bool startsEndTag() const noexcept { return left() >= 2 && at_[0] == '<' && at_[1] == '/'; }

  // Moves behind the text if it stands here.
  bool take(std::string_view text) noexcept {
    if (left() < text.size() || std::memcmp(at_, text.data(), text.size()) != 0) return false;
    at_ += text.size();
    return true;
  }
  bool take(char c) noexcept {
    if (at_ == end_ || *at_ != c) return false;
    ++at_;
    return true;
  }
  // Moves behind white space; true if there was any.
  bool space() noexcept {
    const char* const from = at_;
    while (at_ != end_ && isXmlSpace(*at_)) ++at_;
    return at_ != from;
  }
  // Moves behind the next such mark, wherever it is.
  bool skipBehind(std::string_view mark) noexcept;

  // The XML declaration, if there is one. `encoding`: what the document came in.
  bool declaration(XmlEncoding encoding) noexcept;
  // The document type, if there is one. It is never fetched; one with an internal part, where entities would
  // be declared, is malformed.
  bool documentType() noexcept;
  // White space, comments and processing instructions, as many as there are.
  bool misc() noexcept;
  // The rest of a comment behind "<!--".
  bool comment() noexcept { return skipBehind("--") && take('>'); }
  // The rest of a processing instruction behind "<?".
  bool instruction() noexcept;

  // The start tag of the root. It has one attribute, the version, whose value does not matter.
  bool rootTag() noexcept;
  // What follows an element's name.
  enum class TagEnd { open, empty, malformed };
  TagEnd tagEnd() noexcept {
    if (take('>')) return TagEnd::open;
    space();
    if (take('>')) return TagEnd::open;
    return take("/>") ? TagEnd::empty : TagEnd::malformed;
  }
  bool endTag(const XmlTag& tag) noexcept { return take(tag.end) || spacedEndTag(tag.name); }

 private:
  bool pseudoAttribute(std::string_view name, std::string_view* value) noexcept;
  bool literal(std::string_view* value) noexcept;
  bool externalId() noexcept;
  bool spacedEndTag(std::string_view name) noexcept;

  const char* at_;
  const char* end_;
};

}  // namespace brenvik::plist
