// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/TreeCopier.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <new>
#include <system_error>
#include <thread>

#include "platform/files/linux/DirectoryNames.h"
#include "platform/files/linux/HeldDirectory.h"

namespace brenvik {
namespace {

constexpr int kOpenDirectory = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
// O_NONBLOCK: what was a file when its directory was read may be a FIFO by now.
constexpr int kOpenFile = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
constexpr int kMakeFile = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;

// From this number of files on, starting a thread costs less than it saves.
constexpr std::size_t kWorthAThread = 64;

}  // namespace

struct TreeCopier::Level {
  HeldDirectory source;
  HeldDirectory destination;
  struct stat info {};
  DirectoryNames names;
  std::size_t pathLength = 0;  // of the path down to this level
};

// The files of one directory, handed out one by one to whoever asks next.
struct TreeCopier::Share {
  int from;
  int to;
  std::vector<const char*> names;
  std::atomic<std::size_t> next{0};
  std::atomic<bool> failed{false};
};

void TreeCopier::learnUmask(int directory) {
  // umask(2) can only be read by changing it, for all threads.
  const UniqueFd probe(::openat(directory, ".", O_TMPFILE | O_WRONLY | O_CLOEXEC, 0777));
  struct stat info {};
  if (probe.isValid() && ::fstat(probe.get(), &info) == 0) umask_ = 0777 & ~info.st_mode;
}

int TreeCopier::copyFileInto(int source, const struct stat& info, int destination) {
  if (const int error = contents_.copyData(source, info, destination); error != 0) return error;
  return contents_.copyAttributes(source, info, destination, FileContents::Owner::asSource);
}

int TreeCopier::copySpecial(int sourceDirectory, const char* name, const struct stat& info,
                            int destinationDirectory, const char* destinationName) {
  if (S_ISLNK(info.st_mode)) {
    char target[PATH_MAX];
    const ssize_t length = ::readlinkat(sourceDirectory, name, target, sizeof target - 1);
    if (length < 0) return errno;
    target[length] = '\0';
    if (::symlinkat(target, destinationDirectory, destinationName) != 0) return errno;
  } else if (S_ISFIFO(info.st_mode) || S_ISSOCK(info.st_mode)) {
    if (::mknodat(destinationDirectory, destinationName, (info.st_mode & S_IFMT) | 0600, 0) != 0)
      return errno;
  } else {
    // A way into a device is not a file's content, and this process could make one for anybody.
    return EPERM;
  }
  const bool owned =
      ::fchownat(destinationDirectory, destinationName, info.st_uid, info.st_gid, AT_SYMLINK_NOFOLLOW) == 0;
  if (!S_ISLNK(info.st_mode) &&
      ::fchmodat(destinationDirectory, destinationName, info.st_mode & (owned ? 07777 : 01777),
                 AT_SYMLINK_NOFOLLOW) != 0) {
    return errno;
  }
  const timespec times[2] = {info.st_atim, info.st_mtim};
  return ::utimensat(destinationDirectory, destinationName, times, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
}

int TreeCopier::copyRegular(FileContents& contents, int from, int to, const char* name,
                            bool* hasSeveralNames) const {
  const UniqueFd file(::openat(from, name, kOpenFile));
  struct stat info {};
  if (!file.isValid() || ::fstat(file.get(), &info) != 0) return errno;
  if (!S_ISREG(info.st_mode)) return EBUSY;  // replaced under our hands
  if (hasSeveralNames != nullptr && info.st_nlink > 1) {
    *hasSeveralNames = true;
    return 0;
  }
  const UniqueFd copy(::openat(to, name, kMakeFile, info.st_mode & 0777));
  if (!copy.isValid()) return errno;
  if (const int error = contents.copyData(file.get(), info, copy.get()); error != 0) return error;
  const bool ownerFits = info.st_uid == ownUid_ && info.st_gid == ownGid_;
  const bool modeFits = ownerFits && (info.st_mode & (umask_ | 07000)) == 0;
  return contents.copyAttributes(file.get(), info, copy.get(),
                                 ownerFits ? FileContents::Owner::asCreated : FileContents::Owner::asSource,
                                 modeFits ? FileContents::Mode::asCreated : FileContents::Mode::asSource);
}

int TreeCopier::workOn(Share& share, FileContents& contents, std::vector<const char*>* severalNames) const {
  while (!share.failed.load(std::memory_order_relaxed)) {
    const std::size_t mine = share.next.fetch_add(1, std::memory_order_relaxed);
    if (mine >= share.names.size()) return 0;
    bool hasSeveralNames = false;
    const char* const name = share.names[mine];
    if (const int error = copyRegular(contents, share.from, share.to, name, &hasSeveralNames); error != 0) {
      share.failed.store(true, std::memory_order_relaxed);
      return error;
    }
    if (hasSeveralNames) severalNames->push_back(name);
  }
  return 0;
}

// Copies a file or another item that may have been copied already under another name.
int TreeCopier::copyAgain(int from, int to, const char* name, const std::string& pathHere, int top) {
  struct stat info {};
  if (::fstatat(from, name, &info, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (info.st_nlink > 1) {
    const auto [known, isFirst] =
        linked_.try_emplace({info.st_dev, info.st_ino}, pathHere.empty() ? name : pathHere + "/" + name);
    // Where a second name cannot be had, a second copy has the same content.
    if (!isFirst && ::linkat(top, known->second.c_str(), to, name, 0) == 0) return 0;
  }
  return S_ISREG(info.st_mode) ? copyRegular(contents_, from, to, name, nullptr)
                               : copySpecial(from, name, info, to, name);
}

int TreeCopier::copyEntries(Level& level, const std::string& pathHere, int top) {
  Share share{level.source.get(), level.destination.get(), {}};
  std::vector<const char*> others;
  for (DirectoryNames::Entry entry{}; level.names.next(&entry);) {
    if (entry.type == DT_REG) {
      share.names.push_back(entry.name);
    } else if (entry.type != DT_DIR) {
      others.push_back(entry.name);
    }
  }
  level.names.rewind();

  int helperError = 0;
  std::vector<const char*> helperOthers;
  std::thread helper;
  if (share.names.size() >= kWorthAThread && std::thread::hardware_concurrency() > 1) {
    try {
      helper = std::thread([this, &share, &helperOthers, &helperError]() noexcept {
        try {
          FileContents contents;
          helperError = workOn(share, contents, &helperOthers);
        } catch (const std::bad_alloc&) {
          helperError = ENOMEM;
        }
      });
    } catch (const std::system_error&) {  // no thread to be had: this one does it all
    }
  }
  int error = 0;
  try {
    error = workOn(share, contents_, &others);
  } catch (const std::bad_alloc&) {
    error = ENOMEM;
    share.failed = true;
  }
  if (helper.joinable()) helper.join();
  if (error == 0) error = helperError;
  if (error != 0) return error;
  others.insert(others.end(), helperOthers.begin(), helperOthers.end());
  for (const char* name : others) {
    if (const int failed = copyAgain(share.from, share.to, name, pathHere, top); failed != 0) return failed;
  }
  return 0;
}

int TreeCopier::copyDirectoryInto(int source, const struct stat& info, int destination) {
  linked_.clear();
  learnUmask(destination);
  std::vector<Level> levels;
  std::string path;
  const auto enter = [&](UniqueFd from, UniqueFd to, const struct stat& about) {
    if (levels.size() >= kHeldLevels) {
      Level& far = levels[levels.size() - kHeldLevels];
      if (const int error = far.source.giveUp(); error != 0) return error;
      if (const int error = far.destination.giveUp(); error != 0) return error;
    }
    levels.push_back({HeldDirectory(std::move(from)), HeldDirectory(std::move(to)), about, {}, path.size()});
    Level& level = levels.back();
    if (const int error = level.names.load(level.source.get()); error != 0) return error;
    return copyEntries(level, path, destination);
  };
  {
    UniqueFd from(::openat(source, ".", kOpenDirectory));
    UniqueFd to(::openat(destination, ".", kOpenDirectory));
    if (!from.isValid() || !to.isValid()) return errno;
    if (const int error = enter(std::move(from), std::move(to), info); error != 0) return error;
  }
  while (!levels.empty()) {
    Level& level = levels.back();
    DirectoryNames::Entry entry{};
    bool more = level.names.next(&entry);
    while (more && entry.type != DT_DIR) more = level.names.next(&entry);
    if (more) {
      struct stat about {};
      UniqueFd from(::openat(level.source.get(), entry.name, kOpenDirectory));
      if (!from.isValid() || ::fstat(from.get(), &about) != 0) return errno;
      if (::mkdirat(level.destination.get(), entry.name, 0700) != 0) return errno;
      UniqueFd to(::openat(level.destination.get(), entry.name, kOpenDirectory));
      if (!to.isValid()) return errno;
      path.resize(level.pathLength);
      if (!path.empty()) path += '/';
      path += entry.name;
      if (const int error = enter(std::move(from), std::move(to), about); error != 0) return error;
      continue;
    }
    // Attributes last: writing into the directory changed its times, and it may become read-only.
    const bool isTop = levels.size() == 1;
    const bool ownerFits = !isTop && level.info.st_uid == ownUid_ && level.info.st_gid == ownGid_;
    if (const int error = contents_.copyAttributes(
            level.source.get(), level.info, level.destination.get(),
            ownerFits ? FileContents::Owner::asCreated : FileContents::Owner::asSource);
        error != 0) {
      return error;
    }
    const Level done = std::move(levels.back());
    levels.pop_back();
    if (levels.empty()) break;
    if (const int error = levels.back().source.takeAgain(done.source.get()); error != 0) return error;
    if (const int error = levels.back().destination.takeAgain(done.destination.get()); error != 0)
      return error;
  }
  return 0;
}

}  // namespace brenvik
