// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// What the binary reader takes, the binary writer writes and the reader reads back as it was. As XML it loses
// the fractions of dates at most, and may be refused for a character or a date.
#include <cstdint>
#include <cstdlib>
#include <span>
#include <string>

#include "platform/plist/PropertyListCodec.h"

namespace {

void require(bool holds) {
  if (!holds) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace brenvik;
  // Most inputs should be about objects; the magic costs the fuzzer nothing this way.
  std::string document(reinterpret_cast<const char*>(data), size);
  if (size >= 8) document.replace(0, 8, "bplist00");
  const PropertyList value = parsePropertyList(std::as_bytes(std::span(document)));
  if (!value) return 0;
  const auto binary = serializePropertyList(value, PropertyListFormat::binary);
  require(binary.has_value());
  const PropertyList again = parsePropertyList(std::as_bytes(std::span(*binary)));
  require(again == value);
  require(serializePropertyList(again, PropertyListFormat::binary) == binary);

  const auto xml = serializePropertyList(value, PropertyListFormat::xml);
  require(serializePropertyList(again, PropertyListFormat::xml) == xml);
  if (!xml) return 0;
  const PropertyList fromXml = parsePropertyList(std::as_bytes(std::span(*xml)));
  require(fromXml.hasValue());
  require(serializePropertyList(fromXml, PropertyListFormat::xml) == xml);
  return 0;
}
