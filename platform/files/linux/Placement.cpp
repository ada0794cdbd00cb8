// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/Placement.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>

#include "platform/files/linux/TreeRemover.h"

namespace brenvik {
namespace {

constexpr int kAttempts = 4;

std::string stageName(std::uint64_t number) {
  char text[32];
  (void)std::snprintf(text, sizeof text, ".brenvik-%016llx", static_cast<unsigned long long>(number));
  return text;
}

// FNV-1a: any spread will do, the names in one directory are few.
std::uint64_t hashOf(const std::string& text) {
  std::uint64_t hash = 0xcbf29ce484222325;
  for (const char c : text) hash = (hash ^ static_cast<unsigned char>(c)) * 0x100000001b3;
  return hash;
}

int renameWithFlags(int directory, const char* from, const char* to, unsigned flags) {
  if (::renameat2(directory, from, directory, to, flags) == 0) return 0;
  if (errno != EINVAL && errno != ENOSYS) return errno;
  // A file system without the flags. Two steps then; nobody else has business in these directories.
  struct stat info {};
  if (flags == RENAME_NOREPLACE) {
    if (::fstatat(directory, to, &info, AT_SYMLINK_NOFOLLOW) == 0) return EEXIST;
    return ::renameat(directory, from, directory, to) == 0 ? 0 : errno;
  }
  return EINVAL;
}

// A default access list of the directory above would change the modes of everything made below.
void dropInheritedAccess(int item) {
  (void)::fremovexattr(item, "system.posix_acl_default");  // usually there is none
  (void)::fremovexattr(item, "system.posix_acl_access");
}

}  // namespace

int Place::open(const std::string& path, Place* place) {
  std::size_t end = path.size();
  while (end > 0 && path[end - 1] == '/') --end;
  if (end == 0) return path.empty() ? ENOENT : EEXIST;
  const std::size_t slash = path.rfind('/', end - 1);
  place->name = slash == std::string::npos ? path.substr(0, end) : path.substr(slash + 1, end - slash - 1);
  if (place->name == "." || place->name == "..") return EEXIST;
  const std::string parent = slash == std::string::npos ? "." : path.substr(0, slash + 1);
  place->directory.reset(::open(parent.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  return place->directory.isValid() ? 0 : errno;
}

Stage::Stage(const Place& place) : place_(place), name_(stageName(hashOf(place.name))) {}

Stage::~Stage() {
  if (named_) (void)removeTree(place_.directory.get(), name_.c_str());  // the next attempt clears what stays
}

// Four names for one place: one that a living process works under leaves three.
void Stage::useName(int attempt) {
  name_ = stageName(hashOf(place_.name) + static_cast<std::uint64_t>(attempt));
}

// Removes what stands under the stage's name, unless a living process works in it. 0 or errno, EBUSY for the
// latter.
int Stage::clearStale() {
  const int directory = place_.directory.get();
  const UniqueFd left(::openat(directory, name_.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (left.isValid() && ::flock(left.get(), LOCK_EX | LOCK_NB) != 0) return EBUSY;
  return removeTree(directory, name_.c_str());
}

int Stage::makeDirectory() {
  const int directory = place_.directory.get();
  // Whichever name a killed process has used, nothing of it stays.
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    useName(attempt);
    if (::faccessat(directory, name_.c_str(), F_OK, AT_SYMLINK_NOFOLLOW) == 0) (void)clearStale();
  }
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    useName(attempt);
    if (::mkdirat(directory, name_.c_str(), 0700) != 0) {
      if (errno != EEXIST) return errno;
      continue;
    }
    named_ = true;
    fd_.reset(::openat(directory, name_.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd_.isValid()) return errno;
    struct stat made {};
    struct stat there {};
    // Between making and locking it, another process may have taken it for a stale one.
    if (::flock(fd_.get(), LOCK_EX | LOCK_NB) == 0 && ::fstat(fd_.get(), &made) == 0 &&
        ::fstatat(directory, name_.c_str(), &there, AT_SYMLINK_NOFOLLOW) == 0 &&
        made.st_ino == there.st_ino && made.st_dev == there.st_dev) {
      dropInheritedAccess(fd_.get());
      // A set-group-id directory above passes its bit on; the source's mode decides, at the end.
      return (made.st_mode & 07777) == 0700 || ::fchmod(fd_.get(), 0700) == 0 ? 0 : errno;
    }
    named_ = false;
  }
  return EBUSY;
}

int Stage::makeFile() {
  const int directory = place_.directory.get();
  fd_.reset(::openat(directory, ".", O_TMPFILE | O_WRONLY | O_CLOEXEC, 0600));
  if (fd_.isValid()) {
    dropInheritedAccess(fd_.get());
    return 0;
  }
  if (errno != EOPNOTSUPP && errno != EISDIR && errno != EINVAL && errno != ENOENT) return errno;
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    useName(attempt);
    if (::faccessat(directory, name_.c_str(), F_OK, AT_SYMLINK_NOFOLLOW) == 0) (void)clearStale();
    fd_.reset(::openat(directory, name_.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
    if (!fd_.isValid()) {
      if (errno != EEXIST) return errno;
      continue;
    }
    named_ = true;
    dropInheritedAccess(fd_.get());
    // Held until the end: tells another process that this one is alive.
    return ::flock(fd_.get(), LOCK_EX | LOCK_NB) == 0 ? 0 : errno;
  }
  return EBUSY;
}

int Stage::reserveName() {
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    useName(attempt);
    struct stat info {};
    if (::fstatat(place_.directory.get(), name_.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0) {
      return errno == ENOENT ? 0 : errno;
    }
    if (clearStale() == 0) return 0;
  }
  return EBUSY;
}

int Stage::publish(IfPresent ifPresent) {
  const int directory = place_.directory.get();
  const char* const target = place_.name.c_str();
  if (!named_) {
    const auto link = [&](const char* name) {
      // The first form needs a capability, the second a mounted /proc.
      if (::linkat(fd_.get(), "", directory, name, AT_EMPTY_PATH) == 0) return 0;
      if (errno == EEXIST || errno == ENOSPC || errno == EDQUOT) return errno;
      char self[32];
      (void)std::snprintf(self, sizeof self, "/proc/self/fd/%d", fd_.get());
      return ::linkat(AT_FDCWD, self, directory, name, AT_SYMLINK_FOLLOW) == 0 ? 0 : errno;
    };
    const int error = link(target);
    if (error != EEXIST || ifPresent == IfPresent::fail) return error;
    if (const int reserved = reserveName(); reserved != 0) return reserved;
    if (const int linked = link(name_.c_str()); linked != 0) return linked;
    named_ = true;
  }
  int error = renameWithFlags(directory, name_.c_str(), target, RENAME_NOREPLACE);
  if (error == EEXIST && ifPresent == IfPresent::replaceNonDirectory) {
    struct stat there {};
    if (::fstatat(directory, target, &there, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    if (S_ISDIR(there.st_mode)) return EEXIST;
    struct stat staged {};
    if (::fstatat(directory, name_.c_str(), &staged, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    if (!S_ISDIR(staged.st_mode)) {
      if (::renameat(directory, name_.c_str(), directory, target) != 0)
        return errno == EISDIR ? EEXIST : errno;
      named_ = false;
      return 0;
    }
    // A directory cannot be renamed over a file, but the two can change places.
    error = renameWithFlags(directory, name_.c_str(), target, RENAME_EXCHANGE);
    if (error == EINVAL) {
      if (::unlinkat(directory, target, 0) != 0) return errno;
      error = ::renameat(directory, name_.c_str(), directory, target) == 0 ? 0 : errno;
      if (error == 0) named_ = false;
      return error;
    }
    if (error != 0) return error;
    if (::fstatat(directory, name_.c_str(), &there, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(there.st_mode)) {
      // A directory took the file's place at the last moment: it goes back.
      (void)renameWithFlags(directory, name_.c_str(), target, RENAME_EXCHANGE);
      return EEXIST;
    }
    return 0;  // the destructor removes what gave way
  }
  if (error == 0) named_ = false;
  return error;
}

}  // namespace brenvik
