// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/baseband/linux/LoaderCache.h"

#include <cstdint>
#include <cstring>

namespace brenvik {
namespace {

// The form that ldconfig writes (glibc 2.2 and later): a header, the entries, the texts they point to.
constexpr std::string_view kMagic = "glibc-ld.so.cache1.1";
struct Header {
  char magic[20];
  std::uint32_t entries;
  std::uint32_t textLength;
  std::uint32_t unused[5];
};
struct Entry {
  std::int32_t flags;
  std::uint32_t name;  // from the start of the cache, bytes
  std::uint32_t path;
  std::uint32_t osVersion;
  std::uint64_t hardware;
};
static_assert(sizeof(Header) == 48 && sizeof(Entry) == 24);

}  // namespace

bool mayBeInLoaderCache(std::span<const std::byte> cache, std::string_view name) noexcept {
  const auto holds = [&] {
    return ::memmem(cache.data(), cache.size(), name.data(), name.size()) != nullptr;
  };
  Header header{};
  if (cache.size() < sizeof header) return holds();
  std::memcpy(&header, cache.data(), sizeof header);
  if (std::string_view(header.magic, sizeof header.magic) != kMagic ||
      (cache.size() - sizeof header) / sizeof(Entry) < header.entries) {
    return holds();
  }
  // Some hundred entries: comparing each costs a tenth of a search through the texts.
  for (std::uint32_t i = 0; i < header.entries; ++i) {
    Entry entry{};
    std::memcpy(&entry, cache.data() + sizeof header + std::size_t{i} * sizeof entry, sizeof entry);
    if (entry.name >= cache.size()) return holds();
    const auto* const text = reinterpret_cast<const char*>(cache.data()) + entry.name;
    const std::size_t room = cache.size() - entry.name;
    if (room > name.size() && text[name.size()] == '\0' && std::memcmp(text, name.data(), name.size()) == 0) {
      return true;
    }
  }
  return false;
}

}  // namespace brenvik
