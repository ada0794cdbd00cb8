// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/UnpackWriter.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "platform/base/WriteAll.h"
#include "platform/files/archive/ArchiveEntryPath.h"
#include "platform/files/archive/ResourceCompanion.h"
#include "platform/files/linux/FileContents.h"
#include "platform/files/linux/TreeCopier.h"

namespace brenvik {

using archive_frame::Kind;

namespace {

constexpr std::size_t kCompanionHead = 64 << 10;
constexpr std::uint64_t kWorthReserving = 1 << 20;
constexpr mode_t kOwnerMayAdd = 0300;
// As many paths of directories as are kept; more than that no bundle has.
constexpr std::size_t kMaxClosedDirectories = 1000;

// The same step by step, for a service manager's filter against set-id files: it cannot look into the
// arguments of openat2(2) and refuses the call whole, or for one that is older than the call. Nothing else
// writes in the stage meanwhile.
UniqueFd walkBeneath(int top, const char* path, int flags) {
  UniqueFd at;
  for (std::string_view rest(path);;) {
    const std::size_t slash = rest.find('/');
    const std::string name(rest.substr(0, slash));
    if (name.empty() || name == "..") {
      errno = EXDEV;
      return {};
    }
    const bool isLast = slash == std::string_view::npos;
    const int step = isLast ? flags : O_PATH | O_DIRECTORY;
    at.reset(::openat(at.isValid() ? at.get() : top, name.c_str(), step | O_NOFOLLOW | O_CLOEXEC));
    if (isLast || !at.isValid()) return at;
    rest.remove_prefix(slash + 1);
  }
}

UniqueFd openBeneath(int top, const char* path, int flags) {
  open_how how{};
  how.flags = static_cast<unsigned>(flags | O_CLOEXEC);
  how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS | RESOLVE_NO_XDEV;
  long fd = 0;
  do {
    fd = ::syscall(SYS_openat2, top, path, &how, sizeof how);
  } while (fd < 0 && (errno == EAGAIN || errno == EINTR));  // EAGAIN: a rename crossed the walk
  if (fd < 0 && (errno == ENOSYS || errno == EPERM)) return walkBeneath(top, path, flags);
  return UniqueFd(static_cast<int>(fd));
}

// An entry's own fault, which the handler may pass over; everything else is the disk's.
bool isFileError(int code) {
  return code == EEXIST || code == ENOTDIR || code == EISDIR || code == ELOOP || code == EXDEV ||
         code == EPERM || code == EINVAL || code == ENAMETOOLONG;
}

}  // namespace

UnpackWriter::UnpackWriter(int top, UnpackOptions options, std::uint64_t mostBytes,
                           std::function<int(const ArchiveFileError&)> onFileError)
    : top_(top),
      options_(options),
      mostBytes_(std::min(mostBytes, kMaxBytes)),
      onFileError_(std::move(onFileError)),
      umask_(umaskIn(top)) {}

int UnpackWriter::fileError(const std::string& path, int code) {
  const int answer = onFileError_ ? onFileError_({path, code}) : archive_answer::stopCopy;
  if (answer == archive_answer::skipFile) return 0;
  stoppedByAnswer_ = true;
  return code;
}

int UnpackWriter::refuseEntry(const std::string& path, int code) {
  if (++entries_ > kMaxEntries) return EFBIG;
  return fileError(path, code);
}

int UnpackWriter::count(std::uint64_t bytes) {
  bytes_ += bytes;
  return bytes_ > mostBytes_ ? EFBIG : 0;
}

// Makes parent_ the directory, and the directory and those above it where they are missing.
int UnpackWriter::openParent(const std::string& directory) {
  if (parent_.isValid() && directory == parentPath_) return 0;
  UniqueFd found = openBeneath(top_, directory.empty() ? "." : directory.c_str(), O_PATH | O_DIRECTORY);
  if (!found.isValid()) {
    if (errno != ENOENT) return errno;
    const std::size_t slash = directory.rfind('/');
    const std::string above = slash == std::string::npos ? std::string() : directory.substr(0, slash);
    if (const int error = openParent(above); error != 0) return error;
    const char* const name = directory.c_str() + (slash == std::string::npos ? 0 : slash + 1);
    if (::mkdirat(parent_.get(), name, 0755) != 0) return errno;
    if ((umask_ & 0755) != 0 && ::fchmodat(parent_.get(), name, 0755, 0) != 0) return errno;
    found = openBeneath(top_, directory.c_str(), O_PATH | O_DIRECTORY);
    if (!found.isValid()) return errno;
  }
  parent_ = std::move(found);
  parentPath_ = directory;
  return 0;
}

int UnpackWriter::makeFile(const char* name, mode_t mode, UniqueFd* file) {
  file->reset(::openat(parent_.get(), name, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode));
  if (!file->isValid()) return errno;
  return (umask_ & mode) == 0 || ::fchmod(file->get(), mode) == 0 ? 0 : errno;
}

int UnpackWriter::setDirectoryMode(const std::string& path, mode_t mode) {
  const UniqueFd directory = openBeneath(top_, path.c_str(), O_RDONLY | O_DIRECTORY);
  return directory.isValid() && ::fchmod(directory.get(), mode) == 0 ? 0 : errno;
}

int UnpackWriter::finish() {
  // From below: the way to a directory leads through those above it.
  for (auto it = closed_.rbegin(); it != closed_.rend(); ++it) {
    if (const int error = setDirectoryMode(it->first, it->second); error != 0) return error;
  }
  return 0;
}

int UnpackWriter::start(const ArchiveEntry& entry) {
  if (!isCleanEntryPath(entry.path)) return EPERM;
  if (entry.kind == Kind::link && !staysInside(entry.path, entry.target)) return EPERM;
  if (entry.kind == Kind::directory) {
    if (const int error = openParent(entry.path); error != 0) return error;
    if ((entry.mode & kOwnerMayAdd) == kOwnerMayAdd || closed_.size() >= kMaxClosedDirectories) {
      return setDirectoryMode(entry.path, entry.mode);
    }
    closed_[entry.path] = entry.mode;
    return 0;
  }
  const std::size_t slash = entry.path.rfind('/');
  const std::string above = slash == std::string::npos ? std::string() : entry.path.substr(0, slash);
  name_ = slash == std::string::npos ? entry.path : entry.path.substr(slash + 1);
  if (const int error = openParent(above); error != 0) return error;
  if (entry.kind == Kind::link) {
    return ::symlinkat(entry.target.c_str(), parent_.get(), name_.c_str()) == 0 ? 0 : errno;
  }
  return makeFile(name_.c_str(), entry.mode, &file_);
}

int UnpackWriter::beginEntry(const ArchiveEntry& entry) {
  if (++entries_ > kMaxEntries) return EFBIG;
  skipping_ = false;
  written_ = 0;
  companionHead_.clear();
  entry_ = entry;
  if (entry.kind == Kind::file && entry.size != archive_frame::kUnknownSize) {
    // Before the first byte: what an archive claims to need is all it will get.
    if (entry.size > mostBytes_ - std::min(bytes_, mostBytes_)) return EFBIG;
  }
  int error = start(entry);
  if (error == 0 && file_.isValid() && entry.size != archive_frame::kUnknownSize &&
      entry.size >= kWorthReserving &&
      ::fallocate(file_.get(), FALLOC_FL_KEEP_SIZE, 0, static_cast<off_t>(entry.size)) != 0 &&
      errno == ENOSPC) {
    error = ENOSPC;
  }
  if (error == 0) return 0;
  if (!isFileError(error)) return error;
  skipping_ = true;
  file_.reset();
  return fileError(entry.path, error);
}

int UnpackWriter::entryData(std::string_view bytes) {
  if (const int error = count(bytes.size()); error != 0) return error;
  written_ += bytes.size();
  if (entry_.size != archive_frame::kUnknownSize && written_ > entry_.size) return EPROTO;
  return skipping_ ? 0 : writeAll(file_.get(), bytes);
}

UnpackWriter::Room UnpackWriter::roomForData() const {
  if (skipping_ || !file_.isValid() || entry_.size == archive_frame::kUnknownSize) return {};
  const std::uint64_t most = std::min(entry_.size - written_, mostBytes_ - std::min(bytes_, mostBytes_));
  return {file_.get(), static_cast<std::size_t>(most)};
}

void UnpackWriter::dataWritten(std::size_t bytes) {
  bytes_ += bytes;
  written_ += bytes;
}

int UnpackWriter::entryCompanion(std::string_view bytes) {
  if (const int error = count(bytes.size()); error != 0) return error;
  if (skipping_ || entry_.kind == Kind::link) return 0;
  companionHead_.append(bytes.substr(0, kCompanionHead - companionHead_.size()));
  if (!options_.resources) return 0;
  if (!companion_.isValid()) {
    const std::size_t slash = entry_.path.rfind('/');
    const std::string above = slash == std::string::npos ? std::string() : entry_.path.substr(0, slash);
    const std::string name =
        "._" + (slash == std::string::npos ? entry_.path : entry_.path.substr(slash + 1));
    if (const int error = openParent(above); error != 0) return error;
    if (const int error = makeFile(name.c_str(), entry_.mode & 0666, &companion_); error != 0) {
      if (!isFileError(error)) return error;
      skipping_ = true;
      if (file_.isValid()) {
        // Its data is still to come and will not be taken: no empty file stays in its place.
        (void)::unlinkat(parent_.get(), name_.c_str(), 0);
        file_.reset();
      }
      return fileError(above.empty() ? name : above + "/" + name, error);
    }
  }
  return writeAll(companion_.get(), bytes);
}

int UnpackWriter::finishEntry() {
  companion_.reset();
  if (skipping_) return 0;
  if (file_.isValid() && entry_.size != archive_frame::kUnknownSize && written_ != entry_.size) return EPROTO;
  if (options_.extendedAttributes && !companionHead_.empty() && entry_.kind != Kind::link) {
    UniqueFd directory;
    if (entry_.kind == Kind::directory)
      directory = openBeneath(top_, entry_.path.c_str(), O_RDONLY | O_DIRECTORY);
    const int item = entry_.kind == Kind::directory ? directory.get() : file_.get();
    for (const auto& [name, value] : extendedAttributesOf(companionHead_)) {
      // Only ever "user.": the other names mean something to the system. What the file system cannot hold
      // stands in the companion still.
      (void)::fsetxattr(item, ("user." + name).c_str(), value.data(), value.size(), 0);
    }
  }
  if (file_.isValid() && entry_.modified != archive_frame::kNoTime) {
    const timespec times[2] = {{0, UTIME_OMIT}, {static_cast<time_t>(entry_.modified), 0}};
    (void)::futimens(file_.get(), times);  // a time that the file system cannot hold
  }
  return 0;
}

int UnpackWriter::endEntry() {
  const int error = finishEntry();
  file_.reset();
  return error;
}

}  // namespace brenvik
