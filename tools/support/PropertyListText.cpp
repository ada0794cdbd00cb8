// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/support/PropertyListText.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <nlohmann/json.hpp>
#include <span>
#include <utility>

#include "platform/base/Utf8.h"
#include "tools/support/Base64.h"

namespace brenvik::tools {
namespace {

constexpr std::size_t kShownBytes = 16;

constexpr double kUnixTimeOf2001 = 978307200;

// Years 0 to 9999, which is what the text has digits for.
bool hasIsoDate(double secondsSince2001) {
  const double unixTime = std::floor(secondsSince2001) + kUnixTimeOf2001;
  return unixTime >= -62167219200.0 && unixTime < 253402300800.0;
}

std::string isoDate(double secondsSince2001) {
  if (!hasIsoDate(secondsSince2001)) return std::to_string(secondsSince2001) + " s since 2001";
  const double unixTime = std::floor(secondsSince2001) + kUnixTimeOf2001;
  const auto seconds = static_cast<std::time_t>(unixTime);
  std::tm parts{};
  ::gmtime_r(&seconds, &parts);
  std::array<char, 64> text{};
  std::snprintf(text.data(), text.size(), "%04d-%02d-%02dT%02d:%02d:%02d", parts.tm_year + 1900,
                parts.tm_mon + 1, parts.tm_mday, parts.tm_hour, parts.tm_min, parts.tm_sec);
  std::string result = text.data();
  const int milliseconds = static_cast<int>((secondsSince2001 - std::floor(secondsSince2001)) * 1000);
  if (milliseconds != 0) {
    std::snprintf(text.data(), text.size(), ".%03d", milliseconds);
    result += text.data();
  }
  return result + 'Z';
}

std::string realText(double value) {
  std::array<char, 64> text{};
  const auto end = std::to_chars(text.data(), text.data() + text.size(), value).ptr;
  return {text.data(), end};
}

std::string dataText(std::span<const std::byte> bytes) {
  std::string text = "<" + std::to_string(bytes.size()) + (bytes.size() == 1 ? " byte" : " bytes");
  const char* separator = ": ";
  for (const std::byte each : bytes.first(std::min(bytes.size(), kShownBytes))) {
    std::array<char, 3> hex{};
    std::snprintf(hex.data(), hex.size(), "%02x", std::to_integer<unsigned>(each));
    text += separator;
    text += hex.data();
    separator = " ";
  }
  return text + (bytes.size() > kShownBytes ? " ...>" : ">");
}

std::string scalarText(const PropertyList& value) {
  switch (value.type()) {
    case PropertyList::Type::boolean:
      return *value.asBoolean() ? "true" : "false";
    case PropertyList::Type::integer:
      return value.asInteger() ? std::to_string(*value.asInteger())
                               : std::to_string(value.asUnsignedInteger().value_or(0));
    case PropertyList::Type::real:
      return realText(*value.asReal());
    case PropertyList::Type::string:
      return printable(*value.asString());
    case PropertyList::Type::data:
      return dataText(*value.asData());
    case PropertyList::Type::date:
      return isoDate(*value.asDate());
    case PropertyList::Type::array:
      return "[]";
    case PropertyList::Type::dictionary:
      return "{}";
  }
  return "";
}

// The key of an object that stands for something JSON has not.
bool isMark(std::string_view key) {
  return key == "base64" || key == "date" || key == "secondsSince2001" || key == "real" ||
         key == "dictionary";
}

bool isFullContainer(const PropertyList& value) { return value.size() != 0; }

void appendHuman(const PropertyList& value, std::size_t indent, std::string& text) {
  const bool isDictionary = value.is(PropertyList::Type::dictionary);
  for (std::size_t i = 0; i < value.size(); ++i) {
    const PropertyList child = value.at(i);
    if (!text.empty()) text += '\n';
    text.append(indent, ' ');
    text += isDictionary ? printable(value.keyAt(i)) + ":" : "-";
    if (isFullContainer(child)) {
      appendHuman(child, indent + 2, text);
    } else {
      text += ' ' + scalarText(child);
    }
  }
}

}  // namespace

std::string printable(std::string_view text) {
  const bool isUtf8 = isValidUtf8(text);
  std::string result;
  for (std::size_t i = 0; i < text.size(); ++i) {
    const auto byte = static_cast<unsigned char>(text[i]);
    // U+0080 to U+009F steer terminals too.
    const bool isC1 = byte == 0xC2 && i + 1 < text.size() && static_cast<unsigned char>(text[i + 1]) < 0xA0;
    const bool isPlain = byte >= 0x20 && byte != 0x7F && (byte < 0x80 || (isUtf8 && !isC1));
    if (isPlain) {
      result += text[i];
    } else if (byte == '\n') {
      result += "\\n";
    } else if (byte == '\t') {
      result += "\\t";
    } else {
      std::array<char, 5> hex{};
      std::snprintf(hex.data(), hex.size(), "\\x%02x", unsigned{byte});
      result += hex.data();
      if (isC1) {
        std::snprintf(hex.data(), hex.size(), "\\x%02x", unsigned{static_cast<unsigned char>(text[++i])});
        result += hex.data();
      }
    }
  }
  return result;
}

std::string humanText(const PropertyList& value) {
  if (!value.hasValue()) return "(no value)";
  if (!isFullContainer(value)) return scalarText(value);
  std::string text;
  appendHuman(value, 0, text);
  return text;
}

nlohmann::ordered_json jsonOf(const PropertyList& value) {
  using Json = nlohmann::ordered_json;
  if (!value.hasValue()) return nullptr;
  switch (value.type()) {
    case PropertyList::Type::boolean:
      return *value.asBoolean();
    case PropertyList::Type::integer:
      return value.asInteger() ? Json(*value.asInteger()) : Json(value.asUnsignedInteger().value_or(0));
    case PropertyList::Type::real:
      return std::isfinite(*value.asReal()) ? Json(*value.asReal())
                                            : Json{{"real", realText(*value.asReal())}};
    case PropertyList::Type::string:
      return *value.asString();
    case PropertyList::Type::data:
      return Json{{"base64", toBase64(*value.asData())}};
    case PropertyList::Type::date:
      return hasIsoDate(*value.asDate()) ? Json{{"date", isoDate(*value.asDate())}}
                                         : Json{{"secondsSince2001", realText(*value.asDate())}};
    case PropertyList::Type::array: {
      Json array = Json::array();
      for (std::size_t i = 0; i < value.size(); ++i) array.push_back(jsonOf(value.at(i)));
      return array;
    }
    case PropertyList::Type::dictionary: {
      Json object = Json::object();
      // The keys are distinct already; the object's own way to add one looks through all that are there.
      auto& entries = object.get_ref<Json::object_t&>();
      for (std::size_t i = 0; i < value.size(); ++i) {
        entries.Json::object_t::Container::emplace_back(std::string(value.keyAt(i)), jsonOf(value.at(i)));
      }
      if (value.size() == 1 && isMark(value.keyAt(0))) return Json{{"dictionary", std::move(object)}};
      return object;
    }
  }
  return nullptr;
}

nlohmann::ordered_json jsonOfText(std::string_view text) {
  if (isValidUtf8(text)) return text;
  return {{"base64", toBase64(std::as_bytes(std::span(text)))}};
}

std::string jsonLine(const nlohmann::ordered_json& value) {
  return value.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
}

}  // namespace brenvik::tools
