// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/TreeRemover.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <string>
#include <system_error>
#include <thread>
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

// From this number of files on, starting a thread costs less than it saves.
constexpr std::size_t kWorthAThread = 64;

// Removes the files of one directory, two at a time where they are many. 0, or one of the errors met.
int removeAll(int directory, const std::vector<const char*>& files) {
  std::atomic<std::size_t> next{0};
  const auto work = [&]() noexcept {
    int first = 0;
    for (;;) {
      const std::size_t mine = next.fetch_add(1, std::memory_order_relaxed);
      if (mine >= files.size()) return first;
      if (::unlinkat(directory, files[mine], 0) != 0 && errno != ENOENT && first == 0) first = errno;
    }
  };
  int helperError = 0;
  std::thread helper;
  if (files.size() >= kWorthAThread && std::thread::hardware_concurrency() > 1) {
    try {
      helper = std::thread([&]() noexcept { helperError = work(); });
    } catch (const std::system_error&) {  // no thread to be had: this one does it all
    }
  }
  const int error = work();
  if (helper.joinable()) helper.join();
  return error != 0 ? error : helperError;
}

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
  // Everything in the level's directory but the directories, which are left for the walk.
  const auto removeFiles = [&remember](Level& level) {
    std::vector<const char*> files;
    for (DirectoryNames::Entry entry{}; level.names.next(&entry);) {
      if (entry.type != DT_DIR) files.push_back(entry.name);
    }
    level.names.rewind();
    remember(removeAll(level.directory.get(), files));
  };
  const auto enter = [&](int parent, const char* child) {
    UniqueFd fd(::openat(parent, child, kOpenFlags));
    if (!fd.isValid()) return errno;
    Level level{HeldDirectory(std::move(fd)), {}, child};
    if (const int error = level.names.load(level.directory.get()); error != 0) return error;
    if (levels.size() >= kHeldLevels) {
      if (const int error = levels[levels.size() - kHeldLevels].directory.giveUp(); error != 0) return error;
    }
    levels.push_back(std::move(level));
    removeFiles(levels.back());
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
      if (entry.type != DT_DIR) continue;
      if (const int error = enter(here, entry.name); error != 0) {
        // Not readable, but perhaps empty; or gone, or no directory any more.
        if (::unlinkat(here, entry.name, AT_REMOVEDIR) != 0 && errno != ENOENT) remember(error);
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
