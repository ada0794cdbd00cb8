// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/TreeWalk.h"

#include <fcntl.h>

#include <cerrno>
#include <utility>

namespace brenvik {

int TreeWalk::opened(Level&, Level&) { return 0; }

int TreeWalk::cannotEnter(Level&, const char*, int error) { return error; }

int TreeWalk::left(Level&, Level*) { return 0; }

int TreeWalk::enter(Level level) {
  level.pathLength = path_.size();
  if (const int error = level.names.load(level.directory.get()); error != 0) return error;
  if (levels_.size() >= kHeldLevels) {
    Level& far = levels_[levels_.size() - kHeldLevels];
    if (const int error = far.directory.giveUp(); error != 0) return error;
    if (const int error = far.counterpart.giveUp(); error != 0) return error;
  }
  levels_.push_back(std::move(level));
  return 0;
}

int TreeWalk::descend(Level& level, const char* name) {
  UniqueFd fd(::openat(level.directory.get(), name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd.isValid()) return errno;
  Level below;
  below.directory = HeldDirectory(std::move(fd));
  if (const int error = opened(level, below); error != 0) return error;
  path_ += '/';
  return enter(std::move(below));
}

int TreeWalk::leave() {
  Level done = std::move(levels_.back());
  levels_.pop_back();
  if (levels_.empty()) return left(done, nullptr);
  path_.resize(done.pathLength - 1);
  Level& above = levels_.back();
  // Before the hook may make the directory one that cannot be left by "..".
  if (const int error = above.directory.takeAgain(done.directory.get()); error != 0) return error;
  if (above.counterpart.get() < 0 && done.counterpart.get() >= 0) {
    if (const int error = above.counterpart.takeAgain(done.counterpart.get()); error != 0) return error;
  }
  return left(done, &above);
}

int TreeWalk::walk(Level top) {
  path_.clear();
  levels_.clear();
  int error = enter(std::move(top));
  while (error == 0 && !levels_.empty()) {
    Level& level = levels_.back();
    path_.resize(level.pathLength);
    DirectoryNames::Entry entry{};
    if (!level.names.next(&entry)) {
      error = leave();
      continue;
    }
    path_ += entry.name;
    bool isWanted = false;
    error = visit(level, entry, &isWanted);
    if (error != 0 || !isWanted) continue;
    // On failure nothing was added, and `level` stands.
    if (const int failed = descend(level, entry.name); failed != 0)
      error = cannotEnter(level, entry.name, failed);
  }
  return error;
}

}  // namespace brenvik
