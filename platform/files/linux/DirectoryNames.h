// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <string>

namespace brenvik {

// The names in one directory, read at once and kept in one block. Not thread-safe.
class DirectoryNames {
 public:
  struct Entry {
    const char* name;    // valid until the next load or the end of the object
    unsigned char type;  // DT_* of getdents64(2); DT_UNKNOWN only for an entry that vanished meanwhile
  };

  // Reads all entries but "." and ".." from the directory's current position, usually its start; stops soon
  // after `most` entries. Returns 0 or an errno; may throw std::bad_alloc.
  int load(int directory, std::size_t most = static_cast<std::size_t>(-1));

  // The next entry; false at the end.
  bool next(Entry* entry);
  // Goes back to the first entry.
  void rewind() { position_ = 0; }

 private:
  std::string packed_;  // a type byte, the name, a NUL, and so on
  std::size_t position_ = 0;
};

}  // namespace brenvik
