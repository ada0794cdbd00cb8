// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>
#include <string_view>

#include "platform/plist/internal/XmlMarkup.h"

namespace brenvik::plist {

// Whether the document is UTF-8 of characters that XML allows (production 2). Everything else here takes that
// for granted.
bool hasOnlyXmlCharacters(std::string_view bytes) noexcept;

// Reads the character data of elements: plain text, references, marked sections, with comments and processing
// instructions between. Every line end becomes a line feed. May throw std::bad_alloc.
class XmlText {
 public:
  // Reads at the place of `in`, which outlives the object.
  explicit XmlText(XmlMarkup& in) noexcept : in_(in) {}

  // Reads up to and with the element's end tag. *value lies in the document or in this object, and is valid
  // until the next call. False when the document is malformed.
  bool read(const XmlTag& element, std::string_view* value);

 private:
  bool markup();
  bool markedSection();
  bool reference();
  bool characterReference();

  XmlMarkup& in_;
  std::string text_;  // for what does not stand in the document as it is meant
};

}  // namespace brenvik::plist
