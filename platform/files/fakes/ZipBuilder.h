// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace brenvik {

// Writes zip archives for tests, stored and not compressed, and lies wherever a test asks for it.
class ZipBuilder {
 public:
  struct Entry {
    std::string name;
    std::string content;
    std::uint32_t mode = 0100644;  // st_mode, type included
    std::uint16_t flags = 0x0800;  // names are UTF-8
    std::optional<std::uint32_t> claimedSize = std::nullopt;
    std::optional<std::uint32_t> claimedChecksum = std::nullopt;
    bool isZip64 = false;
    bool hasDescriptor = false;  // sizes and checksum behind the data
    std::optional<std::string> localName =
        std::nullopt;         // another name before the data than in the directory
    bool sharesData = false;  // with the entry before: only its directory has it
  };

  ZipBuilder& add(Entry entry) {
    entries_.push_back(std::move(entry));
    return *this;
  }
  ZipBuilder& file(std::string name, std::string content, std::uint32_t mode = 0100644) {
    return add({.name = std::move(name), .content = std::move(content), .mode = mode});
  }
  ZipBuilder& directory(std::string name) {
    return add({.name = std::move(name) + "/", .content = "", .mode = 040755});
  }
  ZipBuilder& link(std::string name, std::string target) {
    return add({.name = std::move(name), .content = std::move(target), .mode = 0120777});
  }

  std::string build() const {
    std::string out;
    std::string central;
    std::uint64_t offset = 0;
    for (const Entry& entry : entries_) {
      if (!entry.sharesData) offset = out.size();
      const std::string& localName = entry.localName ? *entry.localName : entry.name;
      const std::uint32_t checksum = entry.claimedChecksum.value_or(checksumOf(entry.content));
      const std::uint32_t size = entry.claimedSize.value_or(static_cast<std::uint32_t>(entry.content.size()));
      const auto stored = static_cast<std::uint32_t>(entry.content.size());
      const auto flags = static_cast<std::uint16_t>(entry.flags | (entry.hasDescriptor ? 8 : 0));
      std::string extra;
      if (entry.isZip64) extra = le(1, 2) + le(16, 2) + le(size, 8) + le(stored, 8);
      const std::uint64_t shownSize = entry.isZip64 ? 0xFFFFFFFF : size;
      const std::uint64_t shownStored = entry.isZip64 ? 0xFFFFFFFF : stored;
      const std::string common =
          le(entry.isZip64 ? 45 : 20, 2) + le(flags, 2) + le(0, 2) + le(0, 2) + le(0x5821, 2);
      if (!entry.sharesData) {
        out += le(0x04034b50, 4) + common +
               (entry.hasDescriptor ? le(0, 4) + le(0, 4) + le(0, 4)
                                    : le(checksum, 4) + le(shownStored, 4) + le(shownSize, 4)) +
               le(localName.size(), 2) + le(extra.size(), 2) + localName + extra + entry.content;
        if (entry.hasDescriptor) out += le(0x08074b50, 4) + le(checksum, 4) + le(stored, 4) + le(size, 4);
      }
      central += le(0x02014b50, 4) + le(0x0314, 2) + common + le(checksum, 4) + le(shownStored, 4) +
                 le(shownSize, 4) + le(entry.name.size(), 2) + le(extra.size(), 2) + le(0, 2) + le(0, 2) +
                 le(0, 2) + le(std::uint64_t{entry.mode} << 16, 4) + le(offset, 4) + entry.name + extra;
    }
    const std::uint64_t start = out.size();
    return out + central + le(0x06054b50, 4) + le(0, 2) + le(0, 2) + le(entries_.size(), 2) +
           le(entries_.size(), 2) + le(central.size(), 4) + le(start, 4) + le(0, 2);
  }

 private:
  static std::string le(std::uint64_t value, int bytes) {
    std::string out;
    for (int i = 0; i < bytes; ++i) out += static_cast<char>(value >> (8 * i) & 0xFF);
    return out;
  }
  static std::uint32_t checksumOf(std::string_view bytes) {  // CRC-32, bit by bit
    std::uint32_t crc = 0xFFFFFFFF;
    for (const char c : bytes) {
      crc ^= static_cast<unsigned char>(c);
      for (int bit = 0; bit < 8; ++bit) crc = crc >> 1 ^ (0xEDB88320 & (0 - (crc & 1)));
    }
    return ~crc;
  }
  std::vector<Entry> entries_;
};

}  // namespace brenvik
