// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/PropertyListCodec.h"

#include <new>
#include <string_view>

#include "platform/plist/internal/BinaryReader.h"
#include "platform/plist/internal/BinaryWriter.h"
#include "platform/plist/internal/Document.h"
#include "platform/plist/internal/XmlReader.h"
#include "platform/plist/internal/XmlWriter.h"

namespace brenvik {

namespace {

// Runs the work of a codec, at the boundary that nothing is thrown across.
template <typename Result, typename Work>
Result guarded(CodecFailure* why, Work work) noexcept {
  CodecFailure unwanted{};
  CodecFailure& failure = why != nullptr ? *why : unwanted;
  try {
    Result result = work();
    failure = result ? CodecFailure::none : CodecFailure::refused;
    return result;
  } catch (const std::bad_alloc&) {
    failure = CodecFailure::noMemory;
  } catch (...) {  // more than a string or a vector can hold: no memory would have sufficed
    failure = CodecFailure::refused;
  }
  return {};
}

}  // namespace

PropertyList parsePropertyList(std::span<const std::byte> bytes, CodecFailure* why) noexcept {
  const std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
  return guarded<PropertyList>(
      why, [&] { return text.starts_with("bplist") ? plist::readBinary(text) : plist::readXml(text); });
}

std::optional<std::string> serializePropertyList(const PropertyList& value, PropertyListFormat format,
                                                 CodecFailure* why) noexcept {
  return guarded<std::optional<std::string>>(why, [&]() -> std::optional<std::string> {
    if (!value) return std::nullopt;
    const plist::Node& root = plist::Access::node(value);
    return format == PropertyListFormat::xml ? plist::writeXml(root) : plist::writeBinary(root);
  });
}

}  // namespace brenvik
