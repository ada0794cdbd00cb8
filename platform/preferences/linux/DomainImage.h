// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/plist/PropertyList.h"
#include "platform/preferences/linux/BinaryObjects.h"

namespace brenvik {

// Bytes that a domain may have as a file, to be read or to be written.
inline constexpr std::size_t kLargestDomain = std::size_t{32} << 20;

// One domain, kept in the very form of its file (a binary property list, version 00, a dictionary on top):
// setting a value touches that entry's bytes and numbers, so a domain of 10,000 keys costs little more than a
// small one. Not for several threads at once. May throw std::bad_alloc; an image it was thrown from is only
// good for being destroyed.
class DomainImage {
 public:
  DomainImage() = default;  // no entries

  // Nothing when the value is not a dictionary.
  static std::optional<DomainImage> of(const PropertyList& dictionary);

  std::size_t size() const noexcept { return entries_.size(); }
  // Bytes of memory held, about.
  std::size_t memory() const noexcept {
    return objects_.capacity() + tail_.capacity() +
           sizeof(std::uint32_t) * (offsets_.capacity() + 2 * entries_.capacity());
  }

  // The key's value, or none.
  PropertyList find(std::string_view key) const;

  enum class Change {
    none,  // the entry was already so
    made,
    refused,  // the domain could not be read again: too deep, too large; nothing has changed
  };
  // Sets the key's value; no value removes the entry. A key that is not valid UTF-8 is refused.
  Change set(std::string_view key, const PropertyList& value);

  // The file's content, in pieces to be written one behind the other. Valid until the next change.
  std::array<std::string_view, 2> content();

 private:
  // Numbers of an entry's objects: the key, its value, what the value refers to.
  struct Entry {
    std::uint32_t first;
  };

  // An entry to be: what set() found out before it touches anything.
  struct Draft {
    std::string bytes;  // of the value's objects
    std::vector<std::uint32_t> offsets;
  };

  std::uint32_t endOfNumbers(std::size_t entry) const noexcept;
  std::size_t endOfBytes(std::size_t entry) const noexcept;
  std::string_view keyObject(std::size_t entry) const noexcept;
  std::size_t entryOf(std::string_view keyObject) const noexcept;
  void makeIndex();
  std::size_t rankOf(std::string_view keyObject) const noexcept;
  bool hasKey(std::size_t rank, std::string_view keyObject) const noexcept;
  void append(std::string_view keyObject, const bplist::Extractor& value);
  void replaceValue(std::size_t entry, const Draft& draft);
  void remove(std::size_t rank);
  void renumberFrom(std::size_t entry, std::int64_t objects, std::int64_t bytes) noexcept;
  void makeRoomFor(std::size_t objects);
  std::size_t sizeOfFile(std::size_t entries, std::size_t objects, std::size_t bytes) const noexcept;
  bool readBack();

  std::string objects_{bplist::kMagic};  // the file up to the dictionary
  std::vector<std::uint32_t> offsets_;   // by object number, in the order of the bytes
  std::vector<Entry> entries_;           // in the order of the bytes
  std::vector<std::uint32_t> byKey_;     // places in entries_, ordered by key object; empty until needed
  std::size_t widthOfReference_ = 1;
  std::uint64_t xmlSize_ = 0;  // of everything ever put in: at least what the XML form takes
  std::string tail_;
};

}  // namespace brenvik
