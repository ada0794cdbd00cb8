// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// Which symbolic links are followed on the way to an item. One that is not followed counts as missing:
// ENOENT.
enum class Links {
  // Those of root or this account in a directory that nobody else may write: others could have any other link
  // lead anywhere. For whatever is made, changed or removed.
  unchangeable,
  // Those, and root's or this account's own links elsewhere, unless ".." stands in their target. Others can
  // move or remove such a link, but not make one, and wherever it stands it leads to the same place or below
  // the directory it stands in. For what is read.
  own
};

// Opens a directory (O_PATH), name by name; the last name is on the way as well. 0 or errno. May throw
// std::bad_alloc.
int openDirectory(const std::string& path, UniqueFd* directory, Links links = Links::unchangeable);

// Opens what is at the path to read it, with flags as for open(2). A link that is itself the last name is
// followed, wherever it leads and whosever it is, unless O_NOFOLLOW is given. 0 or errno. May throw
// std::bad_alloc.
int openToRead(const std::string& path, int flags, UniqueFd* item);

// The directory an item is to stand in, opened, and the item's name there.
struct Place {
  UniqueFd directory;
  std::string name;

  // Opens the directory part of the path, as openDirectory() does. 0 or errno; EEXIST for a path that names a
  // directory by itself ("/", "." or ".." at the end). May throw std::bad_alloc.
  static int open(const std::string& path, Place* place, Links links = Links::unchangeable);

  // The same for an item that is there already. A path that names a directory by itself or ends in a slash is
  // that directory and the name ".".
  static int openExisting(const std::string& path, Place* place, Links links);
};

}  // namespace brenvik
