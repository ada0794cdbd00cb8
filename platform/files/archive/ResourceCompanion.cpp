// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/archive/ResourceCompanion.h"

#include <cstdint>

#include "platform/base/Utf8.h"

namespace brenvik {
namespace {

constexpr std::uint32_t kMagic = 0x00051607;  // RFC 1740, a header file beside the data
constexpr std::uint32_t kAttributesEntry = 9;
constexpr std::size_t kBlockOffset = 34;  // behind the entry's 32 bytes and two of padding
constexpr std::uint32_t kBlockMagic = 0x41545452;
constexpr std::size_t kFirstAttribute = kBlockOffset + 36;  // behind the block's own head
constexpr std::size_t kMaxAttributes = 64;
constexpr std::size_t kLongestName = 200;  // "user." goes before it, and the kernel's limit is 255

// Big-endian; nothing beyond the end.
struct Reader {
  std::string_view bytes;
  bool number(std::size_t at, std::size_t width, std::uint32_t* value) const {
    if (at > bytes.size() || bytes.size() - at < width) return false;
    *value = 0;
    for (std::size_t i = 0; i < width; ++i) *value = *value << 8 | static_cast<unsigned char>(bytes[at + i]);
    return true;
  }
};

using Attributes = std::vector<std::pair<std::string, std::string>>;

// Appends the attributes of the block at `offset`, as far as they make sense.
void readBlock(const Reader& all, std::uint32_t offset, Attributes* found) {
  const std::string_view companion = all.bytes;
  std::uint32_t magic = 0;
  std::uint32_t count = 0;
  if (!all.number(offset + kBlockOffset, 4, &magic) || magic != kBlockMagic ||
      !all.number(offset + kFirstAttribute - 2, 2, &count)) {
    return;
  }
  std::size_t next = offset + kFirstAttribute;
  for (std::uint32_t k = 0; k < count && found->size() < kMaxAttributes; ++k) {
    std::uint32_t valueAt = 0;
    std::uint32_t valueLength = 0;
    std::uint32_t nameLength = 0;  // its NUL included
    if (!all.number(next, 4, &valueAt) || !all.number(next + 4, 4, &valueLength) ||
        !all.number(next + 10, 1, &nameLength) || companion.size() - next - 11 < nameLength) {
      return;
    }
    std::string_view name = companion.substr(next + 11, nameLength);
    name = name.substr(0, name.find('\0'));
    next = (next + 11 + nameLength + 3) & ~std::size_t{3};
    if (name.empty() || name.size() > kLongestName || !isValidUtf8(name)) continue;
    if (valueAt > companion.size() || companion.size() - valueAt < valueLength) continue;
    found->emplace_back(name, companion.substr(valueAt, valueLength));
  }
}

}  // namespace

std::vector<std::pair<std::string, std::string>> extendedAttributesOf(std::string_view companion) {
  Attributes found;
  const Reader all{companion};
  std::uint32_t magic = 0;
  std::uint32_t entries = 0;
  if (!all.number(0, 4, &magic) || magic != kMagic || !all.number(24, 2, &entries)) return found;
  for (std::uint32_t i = 0; i < entries; ++i) {
    std::uint32_t id = 0;
    std::uint32_t offset = 0;
    const std::size_t at = 26 + std::size_t{12} * i;
    if (!all.number(at, 4, &id) || !all.number(at + 4, 4, &offset)) return found;
    if (id != kAttributesEntry || offset > companion.size()) continue;
    readBlock(all, offset, &found);
    return found;
  }
  return found;
}

}  // namespace brenvik
