// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/TreeRemover.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <memory>
#include <new>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/files/linux/DirectoryNames.h"
#include "platform/files/linux/HeldDirectory.h"
#include "platform/files/linux/SecondThread.h"

namespace brenvik {
namespace {

constexpr int kOpenFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

// One of the errors met, by whichever thread.
class FirstError {
 public:
  void remember(int error) {
    int none = 0;
    error_.compare_exchange_strong(none, error, std::memory_order_relaxed);
  }
  int get() const { return error_.load(std::memory_order_relaxed); }

 private:
  std::atomic<int> error_{0};
};

// What is in a directory; everything but the directories may be handed over.
class Contents final : public DirectoryWork {
 public:
  explicit Contents(FirstError& error) : error_(error) {}

  DirectoryNames names;

  // 0 or errno; may throw std::bad_alloc.
  int load(int directory) {
    if (const int error = names.load(directory); error != 0) return error;
    for (DirectoryNames::Entry entry{}; names.next(&entry);) {
      if (entry.type != DT_DIR) fileNames_.push_back(entry.name);
    }
    names.rewind();
    return 0;
  }
  bool isHandedOver() const { return directory_.isValid(); }
  // A descriptor of its own: the walk may give its own up before the files are gone.
  bool prepareHandingOver(int directory) {
    directory_.reset(::fcntl(directory, F_DUPFD_CLOEXEC, 0));
    return directory_.isValid();
  }

  std::size_t files() const noexcept override { return fileNames_.size(); }
  void work(bool) noexcept override { removeFiles(directory_.get()); }
  void removeFiles(int directory) noexcept {
    for (;;) {
      const std::size_t mine = next_.fetch_add(1, std::memory_order_relaxed);
      if (mine >= fileNames_.size()) return;
      if (::unlinkat(directory, fileNames_[mine], 0) != 0 && errno != ENOENT) error_.remember(errno);
    }
  }

 private:
  FirstError& error_;
  std::vector<const char*> fileNames_;
  UniqueFd directory_;
  std::atomic<std::size_t> next_{0};
};

struct Level {
  HeldDirectory directory;
  std::shared_ptr<Contents> contents;
  std::string name;                // in the level above
  std::vector<std::string> later;  // directories to remove when the files that were handed over are gone
};

class Walk {
 public:
  explicit Walk(int above) : above_(above) {}

  int enter(int parent, const char* name) {
    UniqueFd fd(::openat(parent, name, kOpenFlags));
    if (!fd.isValid()) return errno;
    auto contents = std::make_shared<Contents>(error_);
    if (const int error = contents->load(fd.get()); error != 0) return error;
    if (levels_.size() >= kHeldLevels) {
      if (const int error = levels_[levels_.size() - kHeldLevels].directory.giveUp(); error != 0)
        return error;
    }
    const int here = fd.get();
    levels_.push_back({HeldDirectory(std::move(fd)), contents, name, {}});
    if (second_.isWorth(contents->files()) && contents->prepareHandingOver(here)) {
      second_.handOver(std::move(contents));
    } else {
      contents->removeFiles(here);
    }
    return 0;
  }

  // 0, or the first errno.
  int run() {
    while (!levels_.empty()) {
      Level& level = levels_.back();
      DirectoryNames::Entry entry{};
      if (level.contents->names.next(&entry)) {
        if (entry.type == DT_DIR) enterOrRemove(level.directory.get(), entry.name);
      } else if (!leave()) {
        return error_.get();  // the way up is gone: nothing more can be removed safely
      }
    }
    return error_.get();
  }

 private:
  void enterOrRemove(int parent, const char* name) {
    if (const int error = enter(parent, name); error != 0) {
      // Not readable, but perhaps empty; or gone, or no directory any more.
      if (::unlinkat(parent, name, AT_REMOVEDIR) != 0 && errno != ENOENT) error_.remember(error);
    }
  }

  void removeDirectory(int parent, const std::string& name) {
    if (::unlinkat(parent, name.c_str(), AT_REMOVEDIR) != 0) error_.remember(errno);
  }

  bool leave() {
    const Level done = std::move(levels_.back());
    levels_.pop_back();
    if (!done.later.empty()) second_.drain();
    for (const std::string& name : done.later) removeDirectory(done.directory.get(), name);
    int above = above_;
    if (!levels_.empty()) {
      if (const int error = levels_.back().directory.takeAgain(done.directory.get()); error != 0) {
        error_.remember(error);
        return false;
      }
      above = levels_.back().directory.get();
    }
    if (done.contents->isHandedOver() && !levels_.empty()) {
      levels_.back().later.push_back(done.name);
      return true;
    }
    if (done.contents->isHandedOver()) second_.drain();
    removeDirectory(above, done.name);
    return true;
  }

  const int above_;
  FirstError error_;
  std::vector<Level> levels_;
  SecondThread second_;
};

// The slow way, for when there is no memory: on the stack, a directory after the other, to a depth that a
// carrier bundle never has.
constexpr int kDeepestWithoutMemory = 64;
constexpr int kMostRounds = 16;

int removeWithoutMemory(int above, const char* name, int depth) noexcept {
  if (::unlinkat(above, name, 0) == 0) return 0;
  if (errno != EISDIR && errno != EPERM) return errno == ENOENT ? 0 : errno;
  const UniqueFd directory(::openat(above, name, kOpenFlags));
  if (!directory.isValid() || depth == kDeepestWithoutMemory) {
    const int error = directory.isValid() ? ENOMEM : errno;
    return ::unlinkat(above, name, AT_REMOVEDIR) == 0 ? 0 : error;
  }
  int first = 0;
  alignas(dirent64) std::array<char, 1024> entries;
  // What is removed while it is listed may hide what follows it from the listing; and somebody may add more.
  bool isChanged = true;
  for (int round = 0; round < kMostRounds && std::exchange(isChanged, false); ++round) {
    first = 0;
    if (::lseek(directory.get(), 0, SEEK_SET) != 0) return errno;
    for (ssize_t size = 0; (size = ::getdents64(directory.get(), entries.data(), entries.size())) > 0;) {
      for (ssize_t at = 0; at < size;) {
        const auto* const entry = reinterpret_cast<const dirent64*>(entries.data() + at);
        at += entry->d_reclen;
        const std::string_view one = entry->d_name;
        if (one == "." || one == "..") continue;
        const int error = removeWithoutMemory(directory.get(), entry->d_name, depth + 1);
        if (error == 0) isChanged = true;
        if (first == 0) first = error;
      }
    }
  }
  if (::unlinkat(above, name, AT_REMOVEDIR) == 0) return 0;
  return first != 0 ? first : errno;
}

int removeQuickly(int directory, const char* name) {
  if (::unlinkat(directory, name, 0) == 0) return 0;
  // EISDIR is Linux's answer for a directory, EPERM the one of POSIX.
  if (errno != EISDIR && errno != EPERM) return errno;
  const int unlinkError = errno;
  Walk walk(directory);
  if (const int error = walk.enter(directory, name); error != 0) {
    // Not readable, but perhaps empty; or no directory at all, and the first answer stands.
    if (::unlinkat(directory, name, AT_REMOVEDIR) == 0) return 0;
    return error == ENOTDIR || error == ELOOP ? unlinkError : error;
  }
  return walk.run();
}

}  // namespace

int removeTree(int directory, const char* name) noexcept {
  try {
    return removeQuickly(directory, name);
  } catch (const std::bad_alloc&) {
    return removeWithoutMemory(directory, name, 0);
  }
}

}  // namespace brenvik
