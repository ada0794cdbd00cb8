// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/StagedMerge.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <utility>

#include "platform/files/linux/TreeWalk.h"

namespace brenvik {
namespace {

// Walks what was staged, with the destination as its counterpart.
class MergingWalk : public TreeWalk {
 public:
  int run(int staged, int destination) {
    Level top;
    top.directory = HeldDirectory(UniqueFd(::openat(staged, ".", kOpenDirectory)));
    top.counterpart = HeldDirectory(UniqueFd(::openat(destination, ".", kOpenDirectory)));
    if (top.directory.get() < 0 || top.counterpart.get() < 0) return errno;
    return walk(std::move(top));
  }

 protected:
  static constexpr int kOpenDirectory = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

  int opened(Level& above, Level& below) override {
    below.counterpart = HeldDirectory(UniqueFd(::openat(above.counterpart.get(), name(), kOpenDirectory)));
    return below.counterpart.get() >= 0 ? 0 : errno;
  }
};

class CheckingWalk final : public MergingWalk {
  int visit(Level& level, const DirectoryNames::Entry& entry, bool* descend) override {
    struct stat there {};
    if (::fstatat(level.counterpart.get(), entry.name, &there, AT_SYMLINK_NOFOLLOW) != 0) {
      return errno == ENOENT ? 0 : errno;
    }
    *descend = entry.type == DT_DIR;
    return *descend == S_ISDIR(there.st_mode) ? 0 : EEXIST;
  }
};

class PlacingWalk final : public MergingWalk {
  int visit(Level& level, const DirectoryNames::Entry& entry, bool* descend) override {
    const int from = level.directory.get();
    const int to = level.counterpart.get();
    if (entry.type != DT_DIR) return ::renameat(from, entry.name, to, entry.name) == 0 ? 0 : errno;
    // rename(2) takes a whole directory where there is none; an empty one would give way, and does not here.
    if (::renameat2(from, entry.name, to, entry.name, RENAME_NOREPLACE) == 0) return 0;
    isMade_ = false;
    if (errno == EINVAL || errno == ENOSYS) {
      isMade_ = ::mkdirat(to, entry.name, 0700) == 0;
      if (!isMade_ && errno != EEXIST) return errno;
    } else if (errno != EEXIST) {
      return errno;
    }
    *descend = true;
    return 0;
  }
  int opened(Level& above, Level& below) override {
    if (const int error = MergingWalk::opened(above, below); error != 0) return error;
    if (!isMade_) return 0;
    struct stat info {};
    if (::fstat(below.directory.get(), &info) != 0) return errno;
    return ::fchmod(below.counterpart.get(), info.st_mode & 0777) == 0 ? 0 : errno;
  }

  bool isMade_ = false;  // the destination's directory, on a file system without the flag
};

}  // namespace

int checkMerge(int staged, int destination) { return CheckingWalk().run(staged, destination); }

int mergeStaged(int staged, int destination) { return PlacingWalk().run(staged, destination); }

}  // namespace brenvik
