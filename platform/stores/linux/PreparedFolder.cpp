// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/stores/linux/PreparedFolder.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <iterator>
#include <new>
#include <string_view>

#include "platform/files/FileManager.h"
#include "platform/files/linux/DirectoryNames.h"
#include "platform/files/linux/Placement.h"

namespace brenvik {
namespace {

constexpr int kFolderFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
// More levels than a path can have.
constexpr int kMaxLevels = 4096;

bool isLackOf(int error) noexcept { return error == ENOMEM || error == EMFILE || error == ENFILE; }

// Whether the folder is root's, and nobody else may write there.
bool isRootsAlone(const struct stat& info) noexcept { return info.st_uid == 0 && (info.st_mode & 0022) == 0; }

// Whether nobody but its owner can have put there, or renamed there, a folder that is its owner's.
bool keepsFolders(const struct stat& info) noexcept {
  return (info.st_mode & 0022) == 0 || (info.st_mode & S_ISVTX) != 0;
}

// Whether something holds for the folder and for each one above it.
template <typename Holds>
bool upToTheRoot(int folder, Holds holds) noexcept {
  UniqueFd at(::openat(folder, ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
  struct stat here {};
  if (!at.isValid() || ::fstat(at.get(), &here) != 0) return false;
  for (int level = 0; level < kMaxLevels && holds(here); ++level) {
    at.reset(::openat(at.get(), "..", O_PATH | O_DIRECTORY | O_CLOEXEC));
    struct stat above {};
    if (!at.isValid() || ::fstat(at.get(), &above) != 0) return false;
    if (here.st_dev == above.st_dev && here.st_ino == above.st_ino) return true;  // the root
    here = above;
  }
  return false;
}

// By what every SQLite database begins with.
bool isDatabase(int file) noexcept {
  constexpr std::string_view kMagic("SQLite format 3\0", 16);
  char head[kMagic.size()];
  return ::pread(file, head, sizeof head, 0) == static_cast<ssize_t>(sizeof head) &&
         std::string_view(head, sizeof head) == kMagic;
}

// Whether everybody may read the file, which has one name and no special bits.
bool isOpenFileOfRoots(const struct stat& info) noexcept {
  return S_ISREG(info.st_mode) && info.st_uid == 0 && info.st_nlink == 1 && (info.st_mode & S_IROTH) != 0 &&
         (info.st_mode & 07000) == 0;
}

UniqueFd openFile(int folder, const std::string& name) noexcept {
  return UniqueFd(::openat(folder, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
}

constexpr const char* kSuffixes[] = {"", "-journal", "-wal", "-shm"};  // of the files of a database

// Makes the folder for the account. 0 or errno; EEXIST is as good.
int makeFolder(const UniqueFd& parent, const char* name, mode_t mode, uid_t uid, gid_t gid) {
  Place place;
  place.directory.reset(::openat(parent.get(), ".", kFolderFlags));
  if (!place.directory.isValid()) return errno;
  place.name = name;
  // In a room that nobody else may enter, until it is the account's: in a folder of the account's own
  // somebody could put another one in its place.
  Stage stage(place);
  if (const int error = stage.makeDirectory(); error != 0) return error;
  if (::fchown(stage.get(), uid, gid) != 0 || ::fchmod(stage.get(), mode) != 0) return errno;
  if (const int error = stage.publish(IfPresent::fail); error != 0) return error == EEXIST ? 0 : error;
  // Or a power cut takes the folder with the tokens in it. The next attempt makes it again.
  if (::fsync(place.directory.get()) != 0) {
    const int error = errno;
    (void)::unlinkat(place.directory.get(), name, AT_REMOVEDIR);
    return error;
  }
  return 0;
}

}  // namespace

StoreFolder::State PreparedFolder::open(IfMissing ifMissing, Opened* folder) noexcept {
  try {
    return walk(ifMissing, folder);
  } catch (const std::bad_alloc&) {
    return State::outOfMemory;
  }
}

StoreFolder::State PreparedFolder::walk(IfMissing ifMissing, Opened* folder) {
  const auto failed = [](int error) {
    if (isLackOf(error)) return State::outOfMemory;
    return error == ENOENT ? State::missing : State::unusable;
  };
  const Account account = account_();
  if (account.home.empty()) return State::missing;
  UniqueFd at;
  if (const int error = openDirectory(account.home, &at); error != 0) return failed(error);
  const struct {
    const char* name;
    mode_t mode;
  } folders[] = {{"Library", 0755}, {name_.c_str(), 0700}};
  for (const auto& each : folders) {
    UniqueFd next(::openat(at.get(), each.name, kFolderFlags));
    if (!next.isValid() && errno == ENOENT && ifMissing == IfMissing::create) {
      const int error = makeFolder(at, each.name, each.mode, account.uid, account.gid);
      if (error != 0) return error == ENOENT ? State::unusable : failed(error);
      next.reset(::openat(at.get(), each.name, kFolderFlags));
    }
    if (!next.isValid()) return failed(errno);
    at = std::move(next);
  }
  struct stat info {};
  if (::fstat(at.get(), &info) != 0) return State::unusable;
  *folder = {std::move(at), info.st_dev, info.st_ino};
  return State::open;
}

bool PreparedFolder::prepare(const Opened& folder) noexcept {
  // Who is not root gives nothing away; and what is not root's is nothing that the worker lacks.
  if (::geteuid() != 0) return false;
  try {
    const Account account = account_();
    if (account.uid == 0) return false;
    const int fd = folder.descriptor.get();
    return isGivenWhole(fd, account) ? giveAll(fd, account) : giveOpenDatabase(fd, account);
  } catch (const std::bad_alloc&) {
    return false;  // what the worker then cannot write is a failure that is told
  }
}

bool PreparedFolder::isGivenWhole(int folder, const Account& account) const {
  struct stat info {};
  if (::fstat(folder, &info) != 0 || !isRootsAlone(info)) return false;
  // Nobody but root can have put it there.
  if (upToTheRoot(folder, [](const struct stat& each) { return each.st_uid == 0 && keepsFolders(each); }))
    return true;
  // In a folder of the account's, which may rename what is there: only what everybody may read, with nothing
  // beside it. A copy could be in its place, so the account gets nothing that it could not have.
  bool isAccounts = false;
  const auto isOpen = [&](const struct stat& each) {
    if (each.st_uid == account.uid) isAccounts = true;
    return (each.st_uid == 0 || each.st_uid == account.uid) && keepsFolders(each) &&
           (isAccounts || (each.st_mode & 0005) == 0005);
  };
  return upToTheRoot(folder, isOpen) && holdsOnlyAnOpenDatabase(folder);
}

// Of a folder that is root's alone: nothing in it changes meanwhile. An empty one is as good.
bool PreparedFolder::holdsOnlyAnOpenDatabase(int folder) const {
  const UniqueFd list(::openat(folder, ".", kFolderFlags));
  DirectoryNames names;
  if (!list.isValid() || names.load(list.get(), std::size(kSuffixes) + 1) != 0) return false;
  for (DirectoryNames::Entry entry{}; names.next(&entry);) {
    const bool isOurs = std::any_of(std::begin(kSuffixes), std::end(kSuffixes),
                                    [&](const char* suffix) { return entry.name == file_ + suffix; });
    const UniqueFd file = isOurs ? openFile(folder, entry.name) : UniqueFd();
    struct stat info {};
    if (!file.isValid() || ::fstat(file.get(), &info) != 0 || !isOpenFileOfRoots(info)) return false;
    if (entry.name == file_ && info.st_size != 0 && !isDatabase(file.get())) return false;
  }
  return true;
}

bool PreparedFolder::giveAll(int folder, const Account& account) const {
  // The files first: as long as the folder is root's alone, nobody puts others in their place. One with
  // further names is something else's, too.
  for (const char* suffix : kSuffixes) {
    const UniqueFd file(::openat(folder, (file_ + suffix).c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    struct stat info {};
    if (!file.isValid() || ::fstat(file.get(), &info) != 0) continue;
    if (!S_ISREG(info.st_mode) || info.st_nlink != 1 || info.st_uid != 0) continue;
    if (::fchownat(file.get(), "", account.uid, account.gid, AT_EMPTY_PATH) != 0) return false;
  }
  return ::fchown(folder, account.uid, account.gid) == 0;
}

// In a folder of the account's own, what is root's may be a private file that was moved there, and stays
// root's. A database that everybody may read is none: who may write the folder may put a copy of it in its
// place, so the account gets nothing that it could not have.
bool PreparedFolder::giveOpenDatabase(int folder, const Account& account) const {
  struct stat info {};
  if (::fstat(folder, &info) != 0 || info.st_uid != account.uid) return false;
  const UniqueFd file = openFile(folder, file_);
  if (!file.isValid() || ::fstat(file.get(), &info) != 0 || !isOpenFileOfRoots(info)) return false;
  if (info.st_size != 0 && !isDatabase(file.get())) return false;
  return ::fchown(file.get(), account.uid, account.gid) == 0;
}

}  // namespace brenvik
