// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/CommandValues.h"

#include <cstdint>
#include <optional>
#include <span>
#include <utility>

#include "platform/plist/PropertyListCodec.h"
#include "tools/support/Base64.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

// The helper answers with XML. A value that XML cannot say would be stored, never be read back, and take its
// whole domain from whoever reads that as a file.
void mustFitXml(const PropertyList& value) {
  if (serializePropertyList(value, PropertyListFormat::xml)) return;
  throw UsageError{
      "VALUE cannot be read back as XML: a text in it holds a control character, a date is outside "
      "the years that can be written, or it is too deep or too large",
      "--type bytes stores any bytes as data; prefs get --raw reads them back."};
}

}  // namespace

PropertyList valueOfType(const std::string& type, const std::string& text, bool isSecret) {
  const auto wrong = [&](const char* what) {
    return UsageError{(isSecret ? "what was read" : '"' + printable(text) + '"') + " is not " + what};
  };
  if (type == "integer") {
    if (const auto number = numberIn<std::int64_t>(text)) return PropertyList::integer(*number);
    if (const auto number = numberIn<std::uint64_t>(text)) return PropertyList::unsignedInteger(*number);
    throw wrong("an integer of 64 bits");
  }
  if (type == "real") {
    if (const auto number = numberIn<double>(text)) return PropertyList::real(*number);
    throw wrong("a number");
  }
  if (type == "bool") {
    if (text == "true" || text == "yes" || text == "1") return PropertyList::boolean(true);
    if (text == "false" || text == "no" || text == "0") return PropertyList::boolean(false);
    throw wrong("true or false");
  }
  if (type == "bytes") return PropertyList::data(std::as_bytes(std::span(text)));
  if (type == "data") {
    if (const auto bytes = fromBase64(text)) return PropertyList::data(*bytes);
    throw wrong("base64");
  }
  PropertyList string = PropertyList::string(text);
  if (!string) throw wrong("UTF-8");
  return string;
}

std::string serialized(const PropertyList& value) {
  auto bytes = serializePropertyList(value, PropertyListFormat::binary);
  if (!bytes) throw UsageError{"the value is too large for a property list"};
  return *std::move(bytes);
}

std::string valueToStore(const Values& values) {
  const std::string type = values.get("--type", "string");
  const std::string& given = values["VALUE"];
  const bool isElsewhere = !values.has("--literal") && ValueReader::standsElsewhere(given);
  // In a document or in data a newline at the end may mean something.
  const LastNewline lastNewline =
      type == "plist-file" || type == "bytes" ? LastNewline::keep : LastNewline::drop;
  ValueReader reader;
  const std::string text = isElsewhere ? reader.read("VALUE", given, lastNewline) : given;
  if (type != "plist-file") {
    const PropertyList value = valueOfType(type, text, isElsewhere);
    mustFitXml(value);
    return serialized(value);
  }
  std::string document = isElsewhere ? text : contentOf(given);
  const PropertyList value = parsePropertyList(std::as_bytes(std::span(document)));
  if (!value) {
    const std::string name =
        given == "-" ? "standard input" : printable(isElsewhere ? given.substr(1) : given);
    throw UsageError{name + " is not a property list"};
  }
  mustFitXml(value);
  return document;
}

const std::string& domainOfAFile(const std::string& domain) {
  if (domain.empty() || domain == "." || domain == ".." || domain.find('/') != std::string::npos) {
    throw UsageError{"DOMAIN: \"" + printable(domain) +
                     "\" names no file: it is empty, \".\" or \"..\", or holds a slash"};
  }
  return domain;
}

}  // namespace brenvik::tools
