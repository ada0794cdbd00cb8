// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/stat.h>

#include <string>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/files/linux/DirectoryNames.h"
#include "platform/files/linux/HeldDirectory.h"

namespace brenvik {

// Goes through everything below a directory, depth first, from one held descriptor to the next. No link is
// followed and no path is resolved, so nobody can lead the walk out of the tree. The names in a directory are
// read when the walk enters it; the hooks may change the tree. One thread; may throw std::bad_alloc.
class TreeWalk {
 public:
  struct Level {
    HeldDirectory directory;
    HeldDirectory counterpart;  // the same directory in a second tree, for a walk of two trees
    struct stat info {};        // for the hooks; the walk does not fill it in
    DirectoryNames names;
    std::size_t pathLength = 0;  // of the path down to this directory, with its slash
  };

  TreeWalk() = default;
  TreeWalk(const TreeWalk&) = delete;
  TreeWalk& operator=(const TreeWalk&) = delete;
  virtual ~TreeWalk() = default;

 protected:
  // Walks everything below the level's directory. 0, or the first value that a hook returned; ESTALE if
  // somebody moved a directory so that the way back up is lost.
  int walk(Level top);

  // The walk has come to an entry. Sets *descend for a directory that is to be walked. This hook and the
  // others return 0 to go on, or an errno value that ends the walk.
  virtual int visit(Level& level, const DirectoryNames::Entry& entry, bool* descend) = 0;
  // A directory below `above` is open; its names have not been read.
  virtual int opened(Level& above, Level& below);
  // Opening the directory, reading its names or opened() failed. The default ends the walk.
  virtual int cannotEnter(Level& level, const char* name, int error);
  // Everything in the directory has been visited. `above` is null for the top.
  virtual int left(Level& done, Level* above);

  // The path of the entry visited, entered or left, below the top.
  const std::string& path() const { return path_; }
  // Its last part.
  const char* name() const {
    const std::size_t slash = path_.rfind('/');
    return path_.c_str() + (slash == std::string::npos ? 0 : slash + 1);
  }

 private:
  int enter(Level level);
  int descend(Level& level, const char* name);
  int leave();

  std::vector<Level> levels_;
  std::string path_;
};

}  // namespace brenvik
