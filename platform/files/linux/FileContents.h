// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/stat.h>

#include <cstdlib>
#include <memory>

namespace brenvik {

// Copies a file's data and attributes. Between calls it keeps a buffer and what it learned about the file
// systems; make one object for each request. One thread.
class FileContents {
 public:
  // Copies the data of `source` into the empty file `destination`, both from their start. Shares blocks if
  // the file system can, and keeps holes. `info` describes the source; the file may be longer or shorter than
  // it says, as files of /proc and /sys are. Returns 0 or an errno. May throw std::bad_alloc.
  int copyData(int source, const struct stat& info, int destination);

  enum class Owner { asCreated, asSource };
  enum class Mode { asCreated, asSource };
  // Gives `destination` the extended attributes, the mode and the times of `source`, and its owner if that is
  // asked for and permitted; without the owner, no set-id bit is copied. Attributes that the destination
  // cannot hold are left out; a full disk is an error. `asCreated`: it is already right. Returns 0 or an
  // errno. May throw std::bad_alloc.
  int copyAttributes(int source, const struct stat& info, int destination, Owner owner,
                     Mode mode = Mode::asSource);

 private:
  char* buffer();
  int copyMapped(int source, int destination, off_t* offset, off_t end);
  int copyRange(int source, int destination, off_t* offset, off_t end);
  int copyRest(int source, int destination, off_t offset);
  int copyDense(int source, const struct stat& info, int destination, off_t* offset);
  int copySparse(int source, const struct stat& info, int destination);
  int copyExtendedAttributes(int source, int destination);

  struct Free {
    void operator()(char* block) const noexcept { std::free(block); }
  };
  std::unique_ptr<char, Free> buffer_;
  bool tryClone_ = true;
  bool tryCopyRange_ = true;
};

}  // namespace brenvik
