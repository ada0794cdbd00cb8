// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/Placement.h"

#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cinttypes>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <string_view>

#include "platform/files/linux/DirectoryNames.h"
#include "platform/files/linux/TreeRemover.h"

namespace brenvik {
namespace {

// ---- hidden names
//
// A process that is killed leaves what it was making. The next operation in the folder removes it, under
// whatever name it is; but in a folder that others may write, too, only what says of itself that it is ours:
//
//   .brenvik-RRRRRRRRRRRRRRRR           a room: a directory of this account's, closed to everybody else, in
//   which
//                                       nothing stands but one item "new", and which nobody has locked
//   .brenvik-IIIIIIIIIIIIIIII-RRRRRRRR  a file whose inode number is I, with no other name, which nobody has
//   locked .brenvik-HHHHHHHHHHHHHHHH-RRRRRRRR  a link of this account's whose target, with R, has the hash H
//
// R is random, so that nobody can be in the way of a name. The process at work holds the lock; a link stands
// under its hidden name for two system calls.

constexpr std::string_view kPrefix = ".brenvik-";
constexpr std::size_t kRoomDigits = 16;
constexpr int kAttempts = 8;
// Of what is looked at in one folder: whoever may write there can fill it. The rest waits for another time.
constexpr std::size_t kMaxEntries = 20'000;
constexpr int kMaxHidden = 1'000;

using HiddenName = char[48];

std::uint64_t randomNumber() {
  std::uint64_t number = 0;
  // A small request is answered whole, once the system is up.
  (void)!::getrandom(&number, sizeof number, 0);
  return number;
}

void nameRoom(HiddenName name) {
  (void)std::snprintf(name, sizeof(HiddenName), ".brenvik-%016" PRIx64, randomNumber());
}

void nameItem(HiddenName name, std::uint64_t number, std::uint32_t random) {
  (void)std::snprintf(name, sizeof(HiddenName), ".brenvik-%016" PRIx64 "-%08" PRIx32, number, random);
}

std::uint32_t randomHalf() { return static_cast<std::uint32_t>(randomNumber()); }

// FNV-1a. Nothing depends on it but whether a link is taken for one of ours.
std::uint64_t hashOf(std::string_view target, std::uint32_t random) {
  std::uint64_t hash = 0xcbf29ce484222325 ^ random;
  for (const char c : target) hash = (hash ^ static_cast<unsigned char>(c)) * 0x100000001b3;
  return hash;
}

bool isSame(const struct stat& a, const struct stat& b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

// Whether the entry is still the item of the descriptor.
bool isEntry(int directory, const char* name, int item) {
  struct stat held {};
  struct stat there {};
  return ::fstat(item, &held) == 0 && ::fstatat(directory, name, &there, AT_SYMLINK_NOFOLLOW) == 0 &&
         isSame(held, there);
}

bool isOwn(const struct stat& info) { return info.st_uid == ::geteuid(); }

bool lock(int item) { return ::flock(item, LOCK_EX | LOCK_NB) == 0; }

void removeStaleRoom(int directory, const char* name) {
  if (std::strspn(name + kPrefix.size(), "0123456789abcdef") != kRoomDigits) return;
  const UniqueFd room(::openat(directory, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  struct stat info {};
  if (!room.isValid() || ::fstat(room.get(), &info) != 0 || !isOwn(info) || (info.st_mode & 0077) != 0)
    return;
  if (!lock(room.get())) return;
  DirectoryNames names;
  if (names.load(room.get()) != 0) return;
  for (DirectoryNames::Entry entry{}; names.next(&entry);) {
    if (std::strcmp(entry.name, Stage::itemName()) != 0) return;
  }
  // From the room, where nobody can put anything in its place. What stays is tried once more next time.
  (void)removeTree(room.get(), Stage::itemName());
  (void)::unlinkat(directory, name, AT_REMOVEDIR);
}

void removeStaleItem(int directory, const char* name) {
  std::uint64_t number = 0;
  std::uint32_t random = 0;
  HiddenName again;
  if (std::sscanf(name + kPrefix.size(), "%16" SCNx64 "-%8" SCNx32, &number, &random) != 2) return;
  nameItem(again, number, random);
  struct stat info {};
  if (std::strcmp(again, name) != 0 || ::fstatat(directory, name, &info, AT_SYMLINK_NOFOLLOW) != 0) return;
  if (S_ISLNK(info.st_mode)) {
    char target[PATH_MAX];
    const ssize_t length = ::readlinkat(directory, name, target, sizeof target);
    if (length <= 0 || !isOwn(info)) return;
    if (hashOf({target, static_cast<std::size_t>(length)}, random) != number) return;
  } else {
    if (!S_ISREG(info.st_mode) || info.st_ino != number || info.st_nlink != 1) return;
    const UniqueFd file(::openat(directory, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!file.isValid() || !lock(file.get()) || !isEntry(directory, name, file.get())) return;
  }
  (void)::unlinkat(directory, name, 0);  // once more next time
}

int renameWithFlags(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) {
  if (::renameat2(fromDirectory, from, toDirectory, to, flags) == 0) return 0;
  if (errno != EINVAL && errno != ENOSYS) return errno;
  // A file system without the flags. Two steps then; nobody else has business in these directories.
  struct stat info {};
  if (flags == RENAME_NOREPLACE) {
    if (::fstatat(toDirectory, to, &info, AT_SYMLINK_NOFOLLOW) == 0) return EEXIST;
    return ::renameat(fromDirectory, from, toDirectory, to) == 0 ? 0 : errno;
  }
  return EINVAL;
}

// A default access list of the directory above would change the modes of everything made below.
void dropInheritedAccess(int item) {
  (void)::fremovexattr(item, "system.posix_acl_default");  // usually there is none
  (void)::fremovexattr(item, "system.posix_acl_access");
}

// Gives an open file without a name one. 0 or errno.
int linkFile(int file, int directory, const char* name) {
  // The first form needs a capability, the second a mounted /proc.
  if (::linkat(file, "", directory, name, AT_EMPTY_PATH) == 0) return 0;
  if (errno == EEXIST || errno == ENOSPC || errno == EDQUOT) return errno;
  char self[32];
  (void)std::snprintf(self, sizeof self, "/proc/self/fd/%d", file);
  return ::linkat(AT_FDCWD, self, directory, name, AT_SYMLINK_FOLLOW) == 0 ? 0 : errno;
}

// Over what is there, unless it is a directory. 0 or errno.
int renameOver(int directory, const char* from, const char* to) {
  if (::renameat(directory, from, directory, to) == 0) return 0;
  return errno == EISDIR ? EEXIST : errno;
}

}  // namespace

void removeLeftovers(int directory) {
  const UniqueFd here(::openat(directory, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  DirectoryNames names;
  if (!here.isValid() || names.load(here.get(), kMaxEntries) != 0) return;
  int hidden = 0;
  for (DirectoryNames::Entry entry{}; names.next(&entry);) {
    const std::string_view name = entry.name;
    if (!name.starts_with(kPrefix)) continue;
    if (++hidden > kMaxHidden) return;
    if (entry.type == DT_DIR && name.size() == kPrefix.size() + kRoomDigits) {
      removeStaleRoom(here.get(), entry.name);
    }
    if (entry.type == DT_REG || entry.type == DT_LNK) removeStaleItem(here.get(), entry.name);
  }
}

int placeLink(const Place& place, const std::string& target) {
  const int directory = place.directory.get();
  struct stat there {};
  if (::fstatat(directory, place.name.c_str(), &there, AT_SYMLINK_NOFOLLOW) != 0) {
    if (errno != ENOENT) return errno;
    return ::symlinkat(target.c_str(), directory, place.name.c_str()) == 0 ? 0 : errno;
  }
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    HiddenName name;
    const std::uint32_t random = randomHalf();
    nameItem(name, hashOf(target, random), random);
    if (::symlinkat(target.c_str(), directory, name) != 0) {
      if (errno == EEXIST) continue;
      return errno;
    }
    // Only now, when the new link is certain.
    int error = 0;
    if (S_ISDIR(there.st_mode) && ::unlinkat(directory, place.name.c_str(), AT_REMOVEDIR) != 0) error = errno;
    if (error == 0) error = renameOver(directory, name, place.name.c_str());
    if (error == ENOENT) continue;                         // another process took it for a leftover
    if (error != 0) (void)::unlinkat(directory, name, 0);  // the failure before it is the answer
    return error;
  }
  return EBUSY;
}

Stage::~Stage() {
  if (!room_.isValid()) return;
  (void)removeTree(room_.get(), itemName());  // what stays is a leftover
  (void)::unlinkat(place_.directory.get(), roomName_.c_str(), AT_REMOVEDIR);
}

int Stage::makeRoom() {
  const int directory = place_.directory.get();
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    HiddenName name;
    nameRoom(name);
    roomName_ = name;  // before anything is made that a lack of memory would leave behind
    if (::mkdirat(directory, name, 0700) != 0) {
      if (errno != EEXIST) return errno;
      continue;
    }
    UniqueFd room(::openat(directory, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!room.isValid()) {
      const int error = errno;
      (void)::unlinkat(directory, name, AT_REMOVEDIR);  // the failure to open it is the answer
      return error;
    }
    struct stat made {};
    // Between making and locking it, another process may have taken it for a stale one, or put another there.
    if (::fstat(room.get(), &made) != 0 || !isOwn(made) || !lock(room.get()) ||
        !isEntry(directory, name, room.get())) {
      continue;
    }
    room_ = std::move(room);
    dropInheritedAccess(room_.get());
    // The mask may have taken too much, and a set-group-id directory above passes its bit on.
    return (made.st_mode & 07777) == 0700 || ::fchmod(room_.get(), 0700) == 0 ? 0 : errno;
  }
  return EBUSY;
}

int Stage::makeDirectory() {
  if (const int error = makeRoom(); error != 0) return error;
  if (::mkdirat(room_.get(), itemName(), 0700) != 0) return errno;
  fd_.reset(::openat(room_.get(), itemName(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  struct stat made {};
  if (!fd_.isValid() || ::fstat(fd_.get(), &made) != 0) return errno;
  return (made.st_mode & 07777) == 0700 || ::fchmod(fd_.get(), 0700) == 0 ? 0 : errno;
}

int Stage::makeFile() {
  if (undo_ == Undo::no) {
    fd_.reset(::openat(place_.directory.get(), ".", O_TMPFILE | O_WRONLY | O_CLOEXEC, 0600));
    if (fd_.isValid()) {
      isUnnamed_ = true;
      dropInheritedAccess(fd_.get());
      return 0;
    }
    if (errno != EOPNOTSUPP && errno != EISDIR && errno != EINVAL && errno != ENOENT) return errno;
  }
  if (const int error = makeRoom(); error != 0) return error;
  fd_.reset(::openat(room_.get(), itemName(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  return fd_.isValid() ? 0 : errno;
}

int Stage::publish(IfPresent ifPresent) {
  if (isUnnamed_) return publishUnnamed(ifPresent);
  struct stat info {};
  if (fd_.isValid() && ::fstat(fd_.get(), &info) != 0) return errno;
  // An ordinary user takes a directory elsewhere only if it is open to its owner.
  const bool isClosed = S_ISDIR(info.st_mode) && (info.st_mode & 0200) == 0 && ::geteuid() != 0;
  if (isClosed && ::fchmod(fd_.get(), (info.st_mode & 07777) | 0200) != 0) return errno;
  const int error = publishFromRoom(ifPresent);
  if (isClosed && ::fchmod(fd_.get(), info.st_mode & 07777) != 0 && error == 0) return errno;
  return error;
}

int Stage::publishUnnamed(IfPresent ifPresent) {
  const int directory = place_.directory.get();
  const char* const target = place_.name.c_str();
  const int error = linkFile(fd_.get(), directory, target);
  if (error != EEXIST || ifPresent == IfPresent::fail) return error;
  struct stat info {};
  if (::fstat(fd_.get(), &info) != 0) return errno;
  (void)lock(fd_.get());  // nobody else has it
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    HiddenName name;
    nameItem(name, info.st_ino, randomHalf());
    const int linked = linkFile(fd_.get(), directory, name);
    if (linked == EEXIST) continue;
    if (linked != 0) return linked;
    const int renamed = renameOver(directory, name, target);
    if (renamed != 0) (void)::unlinkat(directory, name, 0);  // the failure before it is the answer
    return renamed;
  }
  return EBUSY;
}

int Stage::publishFromRoom(IfPresent ifPresent) {
  const int directory = place_.directory.get();
  const char* const target = place_.name.c_str();
  int error = renameWithFlags(room_.get(), itemName(), directory, target, RENAME_NOREPLACE);
  if (error != EEXIST || ifPresent == IfPresent::fail) return error;
  struct stat there {};
  struct stat staged {};
  if (::fstatat(directory, target, &there, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (S_ISDIR(there.st_mode)) return EEXIST;
  if (::fstatat(room_.get(), itemName(), &staged, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (!S_ISDIR(staged.st_mode) && undo_ == Undo::no) {
    if (::renameat(room_.get(), itemName(), directory, target) == 0) return 0;
    return errno == EISDIR ? EEXIST : errno;
  }
  // A directory cannot be renamed over a file, but the two can change places.
  error = renameWithFlags(room_.get(), itemName(), directory, target, RENAME_EXCHANGE);
  if (error == EINVAL) {
    // A file system without the flag.
    if (S_ISDIR(staged.st_mode) && ::unlinkat(directory, target, 0) != 0) return errno;
    return ::renameat(room_.get(), itemName(), directory, target) == 0 ? 0 : errno;
  }
  if (error != 0) return error;
  if (::fstatat(room_.get(), itemName(), &there, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(there.st_mode)) {
    // A directory took the file's place at the last moment: it goes back.
    (void)renameWithFlags(room_.get(), itemName(), directory, target, RENAME_EXCHANGE);
    return EEXIST;
  }
  exchanged_ = true;
  return 0;
}

int Stage::take(const struct stat& info) {
  const int directory = place_.directory.get();
  const char* const name = place_.name.c_str();
  if (::renameat(directory, name, room_.get(), itemName()) != 0) return errno;
  struct stat taken {};
  if (::fstatat(room_.get(), itemName(), &taken, AT_SYMLINK_NOFOLLOW) == 0 && isSame(taken, info)) return 0;
  // Somebody has put something else there: it goes back.
  return ::renameat(room_.get(), itemName(), directory, name) == 0 ? EBUSY : errno;
}

int Stage::takeBack() {
  const int directory = place_.directory.get();
  const char* const target = place_.name.c_str();
  const unsigned flags = exchanged_ ? RENAME_EXCHANGE : RENAME_NOREPLACE;
  if (const int error = renameWithFlags(directory, target, room_.get(), itemName(), flags); error != 0) {
    return error;
  }
  if (!fd_.isValid() || isEntry(room_.get(), itemName(), fd_.get())) return 0;
  // Somebody has put something else there: it goes back.
  return renameWithFlags(room_.get(), itemName(), directory, target, flags) == 0 ? EBUSY : errno;
}

}  // namespace brenvik
