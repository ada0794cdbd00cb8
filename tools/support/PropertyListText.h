// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <nlohmann/json_fwd.hpp>
#include <string>
#include <string_view>

#include "platform/plist/PropertyList.h"

// Property lists as people and programs read them.
namespace brenvik::tools {

// A text that may be shown on a terminal: control characters and broken UTF-8 become \xNN, \n and the like.
std::string printable(std::string_view text);

// Lines, without the last line's end. A text, number or date stands as it is; a container is indented, a key
// or element a line. Data is shown by its length and its first bytes, in hex.
std::string humanText(const PropertyList& value);

// Dictionaries, arrays, texts, numbers and booleans as such; a date as its ISO 8601 text; data as
// {"base64": "..."}; a number that JSON has not ("nan", "inf", "-inf") as text; no value as null.
nlohmann::ordered_json jsonOf(const PropertyList& value);

// One line, whatever the texts in it are.
std::string jsonLine(const nlohmann::ordered_json& value);

}  // namespace brenvik::tools
