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

// Dictionaries, arrays, texts, numbers and booleans as such, no value as null. What JSON has not is an object
// of one member: {"base64": "..."} for data, {"date": "..."} for a date (ISO 8601) or, outside the years 0 to
// 9999, {"secondsSince2001": "..."}, {"real": "nan"} (or "inf", "-inf"). A dictionary whose one key is one of
// these names, or "dictionary", is {"dictionary": {...}}, so that nothing is taken for something else.
nlohmann::ordered_json jsonOf(const PropertyList& value);

// A text of unknown bytes: text where it is UTF-8, else {"base64": "..."}.
nlohmann::ordered_json jsonOfText(std::string_view text);

// One line, whatever the texts in it are.
std::string jsonLine(const nlohmann::ordered_json& value);

}  // namespace brenvik::tools
