// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>

namespace brenvik::plist {

class Document;
struct Access;
struct Foreign;

enum class Tag : std::uint8_t {
  none,
  boolean,
  integer,          // within int64
  unsignedInteger,  // above INT64_MAX only, so that equal numbers have equal tags
  real,
  date,
  string,
  data,
  array,
  dictionary,
  foreign,  // a value that another document owns
  pending,  // only inside a reader: begun but not finished
};

// One value, 16 bytes. Strings, data and children lie in the arena of a Document (or are constants of the
// program); a container shared by two parents is two nodes with one pointer. Internal to this folder.
struct Node {
  Tag tag = Tag::none;
  std::uint8_t hash[3] = {};  // of a dictionary's key: low 24 bits of hashOf(); of anything else: ignored
  std::uint32_t size = 0;     // bytes of a string or data, elements of an array, entries of a dictionary
  union {
    std::uint64_t bits = 0;
    std::int64_t integer;  // boolean: 0 or 1
    std::uint64_t unsignedInteger;
    double real;  // date: seconds since 2001
    const char* text;
    // An array's elements, or a dictionary's key, value, key, value ... with, above kLargestUnindexed
    // entries, a hash index behind them.
    const Node* children;
    const Foreign* foreign;
  };

  bool isContainer() const noexcept { return tag == Tag::array || tag == Tag::dictionary; }
  // Nodes behind `children`.
  std::size_t childCount() const noexcept {
    return tag == Tag::dictionary ? std::size_t{size} * 2 : std::size_t{size};
  }
};
static_assert(sizeof(Node) == 16);

}  // namespace brenvik::plist
