// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/TreeRemover.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <vector>

#include "platform/files/linux/DirectoryNames.h"
#include "platform/files/linux/HeldDirectory.h"

namespace brenvik {
namespace {

struct Level {
  HeldDirectory directory;
  DirectoryNames names;
  std::string name;  // in the level above
};

constexpr int kOpenFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

}  // namespace

int removeTree(int directory, const char* name) {
  if (::unlinkat(directory, name, 0) == 0) return 0;
  // EISDIR is Linux's answer for a directory, EPERM the one of POSIX.
  if (errno != EISDIR && errno != EPERM) return errno;
  const int unlinkError = errno;
  int first = 0;
  const auto remember = [&first](int error) {
    if (first == 0) first = error;
  };
  std::vector<Level> levels;
  const auto enter = [&](int parent, const char* child) {
    UniqueFd fd(::openat(parent, child, kOpenFlags));
    if (!fd.isValid()) return errno;
    Level level{HeldDirectory(std::move(fd)), {}, child};
    if (const int error = level.names.load(level.directory.get()); error != 0) return error;
    if (levels.size() >= kHeldLevels) {
      if (const int error = levels[levels.size() - kHeldLevels].directory.giveUp(); error != 0) return error;
    }
    levels.push_back(std::move(level));
    return 0;
  };

  if (const int error = enter(directory, name); error != 0) {
    // Not readable, but perhaps empty; or no directory at all, and the first answer stands.
    if (::unlinkat(directory, name, AT_REMOVEDIR) == 0) return 0;
    return error == ENOTDIR || error == ELOOP ? unlinkError : error;
  }
  while (!levels.empty()) {
    Level& level = levels.back();
    DirectoryNames::Entry entry{};
    if (level.names.next(&entry)) {
      const int here = level.directory.get();
      if (entry.type != DT_DIR) {
        if (::unlinkat(here, entry.name, 0) == 0 || errno == ENOENT) continue;
        if (errno != EISDIR && errno != EPERM) {
          remember(errno);
          continue;
        }
      }
      const int savedErrno = entry.type == DT_DIR ? 0 : errno;
      if (const int error = enter(here, entry.name);
          error != 0 && ::unlinkat(here, entry.name, AT_REMOVEDIR) != 0) {
        remember(savedErrno == EPERM && (error == ENOTDIR || error == ELOOP) ? savedErrno : error);
      }
      continue;
    }
    const Level done = std::move(levels.back());
    levels.pop_back();
    int above = directory;
    if (!levels.empty()) {
      if (const int error = levels.back().directory.takeAgain(done.directory.get()); error != 0) {
        remember(error);
        return first;  // the way up is gone: nothing more can be removed safely
      }
      above = levels.back().directory.get();
    }
    if (::unlinkat(above, done.name.c_str(), AT_REMOVEDIR) != 0) remember(errno);
  }
  return first;
}

}  // namespace brenvik
