// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/PropertyListCodec.h"

#include <string_view>

#include "platform/plist/internal/BinaryReader.h"
#include "platform/plist/internal/BinaryWriter.h"
#include "platform/plist/internal/Document.h"
#include "platform/plist/internal/XmlReader.h"
#include "platform/plist/internal/XmlWriter.h"

namespace brenvik {

PropertyList parsePropertyList(std::span<const std::byte> bytes) {
  const std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
  return text.starts_with("bplist") ? plist::readBinary(text) : plist::readXml(text);
}

std::optional<std::string> serializePropertyList(const PropertyList& value, PropertyListFormat format) {
  if (!value) return std::nullopt;
  const plist::Node& root = plist::Access::node(value);
  return format == PropertyListFormat::xml ? plist::writeXml(root) : plist::writeBinary(root);
}

}  // namespace brenvik
