// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/TreeCopier.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <utility>

#include "platform/files/linux/TreeWalk.h"

namespace brenvik {
namespace {

constexpr int kOpenDirectory = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
// O_NONBLOCK: what was a file when its directory was read may be a FIFO by now.
constexpr int kOpenFile = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
constexpr int kMakeFile = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;

}  // namespace

mode_t umaskIn(int directory) noexcept {
  // umask(2) can only be read by changing it, for all threads.
  const UniqueFd probe(::openat(directory, ".", O_TMPFILE | O_WRONLY | O_CLOEXEC, 0777));
  struct stat info {};
  return probe.isValid() && ::fstat(probe.get(), &info) == 0 ? 0777 & ~info.st_mode : 0777;
}

// Whether the item (`name` empty: the descriptor's own) can be removed later on. 0 or errno.
int TreeCopier::checkRemovable(int directory, const char* name) const {
  if (afterwards_ == Source::stays) return 0;
  struct statx info {};
  if (::statx(directory, name, AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT, STATX_TYPE, &info) !=
      0) {
    return errno;
  }
  if ((info.stx_attributes & STATX_ATTR_MOUNT_ROOT) != 0) return EBUSY;
  if ((info.stx_attributes & (STATX_ATTR_IMMUTABLE | STATX_ATTR_APPEND)) != 0) return EPERM;
  // What is in a directory goes only if the directory may be written.
  if (S_ISDIR(info.stx_mode) && ::faccessat(directory, ".", W_OK | X_OK, AT_EACCESS) != 0) return errno;
  return 0;
}

int TreeCopier::copyFileInto(int source, const struct stat& info, int destination) {
  if (const int error = checkRemovable(source, ""); error != 0) return error;
  if (const int error = contents_.copyData(source, info, destination); error != 0) return error;
  return contents_.copyAttributes(source, info, destination, FileContents::Owner::asSource);
}

int TreeCopier::copySpecial(int sourceDirectory, const char* name, const struct stat& info,
                            int destinationDirectory, const char* destinationName) {
  if (const int error = checkRemovable(sourceDirectory, name); error != 0) return error;
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

bool TreeCopier::linkAgain(const struct stat& info, int to, const char* name, const std::string& path) {
  if (info.st_nlink < 2) return false;
  const auto [known, isFirst] = linked_.try_emplace({info.st_dev, info.st_ino}, path);
  // Where a second name cannot be had, a second copy has the same content.
  return !isFirst && ::linkat(top_, known->second.c_str(), to, name, 0) == 0;
}

int TreeCopier::copyRegular(int from, int to, const char* name, const std::string& path) {
  const UniqueFd file(::openat(from, name, kOpenFile));
  struct stat info {};
  if (!file.isValid() || ::fstat(file.get(), &info) != 0) return errno;
  if (!S_ISREG(info.st_mode)) return EBUSY;  // replaced under our hands
  if (const int error = checkRemovable(file.get(), ""); error != 0) return error;
  if (linkAgain(info, to, name, path)) return 0;
  const UniqueFd copy(::openat(to, name, kMakeFile, info.st_mode & 0777));
  if (!copy.isValid()) return errno;
  if (const int error = contents_.copyData(file.get(), info, copy.get()); error != 0) return error;
  const bool ownerFits = info.st_uid == ownUid_ && info.st_gid == ownGid_;
  const bool modeFits = ownerFits && (info.st_mode & (umask_ | 07000)) == 0;
  return contents_.copyAttributes(file.get(), info, copy.get(),
                                  ownerFits ? FileContents::Owner::asCreated : FileContents::Owner::asSource,
                                  modeFits ? FileContents::Mode::asCreated : FileContents::Mode::asSource);
}

// The counterpart is the copy in the making.
class TreeCopier::CopyingWalk final : public TreeWalk {
 public:
  explicit CopyingWalk(TreeCopier& owner) : owner_(owner) {}

  int run(int source, const struct stat& info, int destination) {
    if (::fstat(destination, &copy_) != 0) return errno;
    Level top;
    top.info = info;
    top.directory = HeldDirectory(UniqueFd(::openat(source, ".", kOpenDirectory)));
    top.counterpart = HeldDirectory(UniqueFd(::openat(destination, ".", kOpenDirectory)));
    if (top.directory.get() < 0 || top.counterpart.get() < 0) return errno;
    if (const int error = check(top); error != 0) return error;
    return walk(std::move(top));
  }

 private:
  int check(const Level& level) const {
    if (const int error = owner_.checkRemovable(level.directory.get(), ""); error != 0) return error;
    // By way of another mount of the same file system the copy may come to stand inside its source.
    return level.info.st_dev == copy_.st_dev && level.info.st_ino == copy_.st_ino ? EINVAL : 0;
  }
  int visit(Level& level, const DirectoryNames::Entry& entry, bool* descend) override {
    const int from = level.directory.get();
    const int to = level.counterpart.get();
    *descend = entry.type == DT_DIR;
    if (*descend) return 0;
    if (entry.type == DT_REG) return owner_.copyRegular(from, to, entry.name, path());
    struct stat info {};
    if (::fstatat(from, entry.name, &info, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    if (S_ISREG(info.st_mode)) return owner_.copyRegular(from, to, entry.name, path());
    if (const int error = owner_.checkRemovable(from, entry.name); error != 0) return error;
    if (owner_.linkAgain(info, to, entry.name, path())) return 0;
    return owner_.copySpecial(from, entry.name, info, to, entry.name);
  }
  int opened(Level& above, Level& below) override {
    if (::fstat(below.directory.get(), &below.info) != 0) return errno;
    if (const int error = check(below); error != 0) return error;
    const int to = above.counterpart.get();
    if (::mkdirat(to, name(), 0700) != 0) return errno;
    below.counterpart = HeldDirectory(UniqueFd(::openat(to, name(), kOpenDirectory)));
    return below.counterpart.get() >= 0 ? 0 : errno;
  }
  int left(Level& done, Level* above) override {
    const bool ownerFits =
        above != nullptr && done.info.st_uid == owner_.ownUid_ && done.info.st_gid == owner_.ownGid_;
    // Last: writing into a directory changes its times, and it may become read-only.
    return owner_.contents_.copyAttributes(
        done.directory.get(), done.info, done.counterpart.get(),
        ownerFits ? FileContents::Owner::asCreated : FileContents::Owner::asSource);
  }

  TreeCopier& owner_;
  struct stat copy_ {};
};

int TreeCopier::copyDirectoryInto(int source, const struct stat& info, int destination) {
  linked_.clear();
  top_ = destination;
  umask_ = umaskIn(destination);
  return CopyingWalk(*this).run(source, info, destination);
}

}  // namespace brenvik
