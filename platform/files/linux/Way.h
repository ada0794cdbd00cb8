// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// Which symbolic links are followed on the path to an item. A link that is not followed counts as missing:
// ENOENT.
enum class Links {
  // Links of root or this account in directories that nobody else may write to; others could redirect any
  // other link. For items that are made, changed or removed.
  unchangeable,
  // Those, and links of root or this account in any directory, unless their target contains "..". Others can
  // move or remove such a link, but cannot make one; wherever it is moved, it leads to the same place or
  // below
  // its directory. For items that are read.
  own
};

// Opens a directory (O_PATH), name by name; `links` applies to the last name as well. Returns 0 or an errno.
// May throw std::bad_alloc.
int openDirectory(const std::string& path, UniqueFd* directory, Links links = Links::unchangeable);

// Opens the item at the path for reading, with flags as for open(2). If the last name is a link, it is
// followed, whoever owns it and wherever it leads, unless O_NOFOLLOW is given. Returns 0 or an errno. May
// throw std::bad_alloc.
int openToRead(const std::string& path, int flags, UniqueFd* item);

// The directory that holds, or will hold, an item, opened; and the item's name there.
struct Place {
  UniqueFd directory;
  std::string name;

  // Opens the directory part of the path, as openDirectory() does. Returns 0 or an errno; EEXIST if the
  // path's last name cannot be made ("/", or "." or ".." at the end). May throw std::bad_alloc.
  static int open(const std::string& path, Place* place, Links links = Links::unchangeable);

  // The same for an item that exists. For "/" and a path that ends in ".", ".." or a slash, the place is that
  // directory itself and the name ".".
  static int openExisting(const std::string& path, Place* place, Links links);
};

}  // namespace brenvik
