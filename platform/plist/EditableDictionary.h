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

namespace brenvik {

namespace plist {
class ObjectWriter;
}

// A dictionary that is changed entry by entry and written as a whole after each change. It is kept in the
// form of its file, a binary property list: setting a value touches the bytes and numbers of that entry, so
// that a change among 10,000 entries costs little more than one among ten. See
// docs/decisions/04-editable-domains.md.
//
// Not for several threads at once. Every function but the queries of size may throw std::bad_alloc; an object
// that set() threw from may only be assigned to or destroyed.
class EditableDictionary {
 public:
  // Bytes that the file may have.
  static constexpr std::size_t kMaxFileSize = std::size_t{32} << 20;

  // Without entries; allocates nothing.
  EditableDictionary();

  // A copy of the dictionary. Nothing when the value is not a dictionary, or is beyond the limits of property
  // lists.
  static std::optional<EditableDictionary> of(const PropertyList& dictionary);

  // Number of entries.
  std::size_t size() const noexcept { return entries_.size(); }
  // Bytes of memory held, about.
  std::size_t memory() const noexcept {
    return objects_.capacity() + tail_.capacity() +
           sizeof(std::uint32_t) * (offsets_.capacity() + entries_.capacity() + byKey_.capacity());
  }

  // The key's value, with memory of its own; no value when there is none.
  PropertyList find(std::string_view key) const;

  enum class Change {
    none,  // the entry was already so
    made,
    // Nothing has changed: with this entry the dictionary could not be read again (too deep, too large), or
    // the key is not valid UTF-8.
    refused,
  };
  // Sets the key's value; an absent value removes the entry.
  Change set(std::string_view key, const PropertyList& value);

  // The file's content, in two pieces to be written one behind the other; valid until the next change.
  std::array<std::string_view, 2> content();

 private:
  struct Draft;
  // Where an entry's objects lie: the key, its value, what the value refers to.
  struct Range {
    std::size_t firstObject;
    std::size_t endObject;
    std::size_t firstByte;
    std::size_t endByte;
  };

  Range rangeOf(std::size_t entry) const noexcept;
  Range valueRangeOf(std::size_t entry) const noexcept;
  std::string_view keyObject(std::size_t entry) const noexcept;
  std::size_t entryOf(std::string_view keyObject) const noexcept;
  void makeIndex();
  std::size_t rankOf(std::string_view keyObject) const noexcept;
  bool hasKey(std::size_t rank, std::string_view keyObject) const noexcept;
  bool holds(std::size_t entry, const Draft& draft) const noexcept;
  void append(std::string_view keyObject, const Draft& draft);
  void replaceValue(std::size_t entry, const Draft& draft);
  Change remove(std::size_t rank);
  void renumberFrom(std::size_t entry, std::int64_t objects, std::int64_t bytes) noexcept;
  void makeRoomFor(std::size_t objects);
  std::size_t sizeOfFile(std::size_t entries, std::size_t objects, std::size_t bytes) const noexcept;
  bool addXmlSize(std::size_t keySize, const plist::ObjectWriter& value) noexcept;
  bool readBack();

  std::string objects_;                 // the file up to the dictionary's own object, which stands last
  std::vector<std::uint32_t> offsets_;  // in objects_, by object number; ascending
  std::vector<std::uint32_t> entries_;  // the number of each entry's key, ascending
  std::vector<std::uint32_t> byKey_;    // places in entries_, ordered by key object; empty until needed
  std::size_t referenceWidth_ = 1;
  // Of everything ever put in, so at least what the XML form takes: its bytes, and its lines.
  std::uint64_t xmlBytes_ = 0;
  std::uint64_t xmlLines_ = 0;
  std::string tail_;  // the rest of the file, made by content()
};

}  // namespace brenvik
