// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/PropertyListCodec.h"

#include <string_view>

#include "platform/plist/BinaryReader.h"
#include "platform/plist/BinaryWriter.h"
#include "platform/plist/Document.h"
#include "platform/plist/XmlReader.h"
#include "platform/plist/XmlWriter.h"

namespace brenvik {

PropertyList parsePropertyList(std::span<const std::byte> bytes) noexcept {
  const std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
  try {
    return text.starts_with("bplist") ? plist::readBinary(text) : plist::readXml(text);
  } catch (...) {  // out of memory, or of what a string or a vector can hold
    return {};
  }
}

std::optional<std::string> serializePropertyList(const PropertyList& value,
                                                 PropertyListFormat format) noexcept {
  if (!value) return std::nullopt;
  try {
    const plist::Node& root = plist::Access::node(value);
    return format == PropertyListFormat::xml ? plist::writeXml(root) : plist::writeBinary(root);
  } catch (...) {
    return std::nullopt;
  }
}

}  // namespace brenvik
