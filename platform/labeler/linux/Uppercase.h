// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>
#include <string_view>

namespace brenvik {

// Returns the text in capitals, composed (NFC), by the rules of the language (ISO 639 code, NUL-terminated):
// the dotted i of Turkish and Azerbaijani, the soft dots of Lithuanian, Greek capitals without accents, the
// Armenian ligature; in any language, Georgian letters stay the everyday ones. `text` is UTF-8. Throws
// std::bad_alloc.
std::string upperCased(std::string_view text, const char* language);

// Returns the text composed (NFC). `text` is UTF-8. Throws std::bad_alloc.
std::string composed(std::string_view text);

}  // namespace brenvik
