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

// Walks everything below a directory, depth first, from one open descriptor to the next. It follows no link
// and resolves no path, so nobody can lead it out of the tree. It reads a directory's names when it enters
// the directory; the hooks may change the tree. One thread; may throw std::bad_alloc.
class TreeWalk {
 public:
  struct Level {
    HeldDirectory directory;
    HeldDirectory counterpart;  // the same directory in a second tree, for a walk of two trees
    struct stat info {};        // for the hooks; the walk does not fill it in
    DirectoryNames names;
    std::size_t pathLength = 0;  // bytes of the path down to this directory, with its slash
  };

  TreeWalk() = default;
  TreeWalk(const TreeWalk&) = delete;
  TreeWalk& operator=(const TreeWalk&) = delete;
  virtual ~TreeWalk() = default;

 protected:
  // Walks everything below the level's directory. Returns 0, or the first other value that a hook returned;
  // ESTALE if somebody moved a directory, so that the walk cannot return to its parent.
  int walk(Level top);

  // Called for each entry. Sets *descend if the walk should enter this directory. Like every hook, it returns
  // 0 to go on, or an errno value to end the walk.
  virtual int visit(Level& level, const DirectoryNames::Entry& entry, bool* descend) = 0;
  // Called when a directory below `above` has been opened, before its names are read.
  virtual int opened(Level& above, Level& below);
  // Called when opening the directory, reading its names or opened() failed. The default ends the walk.
  virtual int cannotEnter(Level& level, const char* name, int error);
  // Called when everything in the directory has been visited. `above` is null for the top.
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
