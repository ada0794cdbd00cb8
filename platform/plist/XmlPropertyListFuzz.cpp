// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// What the XML reader takes, both writers can write and both readers read back as it was.
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
  // The other reader has a target of its own.
  if (size >= 6 && std::string_view(reinterpret_cast<const char*>(data), 6) == "bplist") return 0;
  const PropertyList value = parsePropertyList(std::as_bytes(std::span(data, size)));
  if (!value) return 0;
  for (const PropertyListFormat format : {PropertyListFormat::xml, PropertyListFormat::binary}) {
    const auto written = serializePropertyList(value, format);
    require(written.has_value());
    require(parsePropertyList(std::as_bytes(std::span(*written))) == value);
  }
  return 0;
}
