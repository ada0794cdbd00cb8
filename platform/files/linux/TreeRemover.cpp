// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/TreeRemover.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <new>
#include <string_view>
#include <utility>

#include "platform/files/linux/TreeWalk.h"

namespace brenvik {
namespace {

constexpr int kOpenFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

// Removes what is in a directory, and goes on past what cannot be removed.
class RemovingWalk final : private TreeWalk {
 public:
  // 0, or the first errno.
  int run(UniqueFd directory) {
    Level top;
    top.directory = HeldDirectory(std::move(directory));
    // When the way up is lost, nothing more can be removed safely.
    remember(walk(std::move(top)));
    return first_;
  }

 private:
  void remember(int error) {
    if (first_ == 0) first_ = error;
  }
  void remove(int directory, const char* name, int flags) {
    if (::unlinkat(directory, name, flags) != 0 && errno != ENOENT) remember(errno);
  }
  int visit(Level& level, const DirectoryNames::Entry& entry, bool* descend) override {
    *descend = entry.type == DT_DIR;
    if (!*descend) remove(level.directory.get(), entry.name, 0);
    return 0;
  }
  int cannotEnter(Level& level, const char* name, int error) override {
    // Not readable, but perhaps empty; or gone, or no directory any more.
    if (::unlinkat(level.directory.get(), name, AT_REMOVEDIR) != 0 && errno != ENOENT) remember(error);
    return 0;
  }
  int left(Level&, Level* above) override {
    if (above != nullptr) remove(above->directory.get(), name(), AT_REMOVEDIR);
    return 0;
  }

  int first_ = 0;
};

// The slow way, for when there is no memory: on the stack, a directory after the other, to a depth that a
// carrier bundle never has.
constexpr int kMaxDepthWithoutMemory = 64;
constexpr int kMaxRounds = 16;

int removeWithoutMemory(int above, const char* name, int depth) noexcept;

// Removes what the directory holds, as far as one listing shows it. *first: the first failure, if there was
// none before. Returns whether anything went.
bool removeListed(int directory, int depth, int* first) noexcept {
  bool isChanged = false;
  alignas(dirent64) std::array<char, 1024> entries;
  for (ssize_t size = 0; (size = ::getdents64(directory, entries.data(), entries.size())) > 0;) {
    for (ssize_t at = 0; at < size;) {
      const auto* const entry = reinterpret_cast<const dirent64*>(entries.data() + at);
      at += entry->d_reclen;
      const std::string_view one = entry->d_name;
      if (one == "." || one == "..") continue;
      const int error = removeWithoutMemory(directory, entry->d_name, depth + 1);
      if (error == 0) isChanged = true;
      if (*first == 0) *first = error;
    }
  }
  return isChanged;
}

int removeWithoutMemory(int above, const char* name, int depth) noexcept {
  if (::unlinkat(above, name, 0) == 0) return 0;
  if (errno != EISDIR && errno != EPERM) return errno == ENOENT ? 0 : errno;
  const UniqueFd directory(::openat(above, name, kOpenFlags));
  if (!directory.isValid() || depth == kMaxDepthWithoutMemory) {
    const int error = directory.isValid() ? ENOMEM : errno;
    return ::unlinkat(above, name, AT_REMOVEDIR) == 0 ? 0 : error;
  }
  int first = 0;
  // What is removed while it is listed may hide what follows it from the listing; and somebody may add more.
  bool isChanged = true;
  for (int round = 0; round < kMaxRounds && isChanged; ++round) {
    first = 0;
    if (::lseek(directory.get(), 0, SEEK_SET) != 0) return errno;
    isChanged = removeListed(directory.get(), depth, &first);
  }
  if (::unlinkat(above, name, AT_REMOVEDIR) == 0) return 0;
  return first != 0 ? first : errno;
}

int removeQuickly(int directory, const char* name) {
  if (::unlinkat(directory, name, 0) == 0) return 0;
  // EISDIR is Linux's answer for a directory, EPERM the one of POSIX.
  if (errno != EISDIR && errno != EPERM) return errno;
  const int unlinkError = errno;
  UniqueFd item(::openat(directory, name, kOpenFlags));
  int error = item.isValid() ? 0 : errno;
  if (error == ENOTDIR || error == ELOOP) return unlinkError;  // no directory: the first answer stands
  if (error == 0) error = RemovingWalk().run(std::move(item));
  // Not readable, but perhaps empty.
  if (::unlinkat(directory, name, AT_REMOVEDIR) == 0) return 0;
  return error != 0 ? error : errno;
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
