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
// form of its file, a binary property list. Setting a value touches only the bytes and numbers of that entry,
// so a change among 10,000 entries costs little more than one among ten. See
// docs/decisions/04-editable-domains.md.
//
// One thread at a time. Every function except size() and memory() may throw std::bad_alloc; after set() has
// thrown, the object may only be assigned to or destroyed.
class EditableDictionary {
 public:
  // The largest file, in bytes.
  static constexpr std::size_t kMaxFileSize = std::size_t{32} << 20;

  // Makes an empty dictionary; allocates nothing.
  EditableDictionary();

  // Returns a copy of the dictionary; nothing if the value is not a dictionary, or exceeds the limits of
  // property lists.
  static std::optional<EditableDictionary> of(const PropertyList& dictionary);

  // Number of entries.
  std::size_t size() const noexcept { return entries_.size(); }
  // The memory held, in bytes, approximately.
  std::size_t memory() const noexcept {
    return objects_.capacity() + tail_.capacity() +
           sizeof(std::uint32_t) * (offsets_.capacity() + entries_.capacity() + byKey_.capacity());
  }

  // Returns the key's value, with memory of its own; no value if there is none.
  PropertyList find(std::string_view key) const;

  enum class Change {
    none,  // the entry was already so
    made,
    // Nothing has changed, because the dictionary could not be read again with this entry (too deep, too
    // large), or because the key is not valid UTF-8.
    refused,
  };
  // Sets the key's value; an absent value removes the entry.
  Change set(std::string_view key, const PropertyList& value);

  // Returns the file's content in two pieces, to be written one after the other; valid until the next change.
  std::array<std::string_view, 2> content();

 private:
  struct Draft;
  // The place of an entry's objects: the key, its value, and the objects that the value refers to.
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
  // Upper limits of the XML form's bytes and lines: the sums over all values ever set.
  std::uint64_t xmlBytes_ = 0;
  std::uint64_t xmlLines_ = 0;
  std::string tail_;  // the rest of the file, made by content()
};

}  // namespace brenvik
