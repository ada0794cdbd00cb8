// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/TreeCopier.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <memory>
#include <mutex>
#include <new>
#include <utility>

#include "platform/files/linux/DirectoryNames.h"
#include "platform/files/linux/HeldDirectory.h"
#include "platform/files/linux/SecondThread.h"

namespace brenvik {
namespace {

constexpr int kOpenDirectory = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
// O_NONBLOCK: what was a file when its directory was read may be a FIFO by now.
constexpr int kOpenFile = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
constexpr int kMakeFile = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;

}  // namespace

// What the threads of one copy share.
class TreeCopier::Crew {
 public:
  Crew(TreeCopier& owner, FileContents& contents) : owner_(owner), contents_(contents) {}
  Crew(const Crew&) = delete;
  Crew& operator=(const Crew&) = delete;
  ~Crew() { fail(ECANCELED); }  // the walk gave up, unless everything is done

  SecondThread& second() { return second_; }
  TreeCopier& owner() const { return owner_; }
  // Of the thread; the second one's are made when it needs them.
  FileContents& contents(bool isOnSecondThread) {
    if (!isOnSecondThread) return contents_;
    if (!secondContents_) secondContents_ = std::make_unique<FileContents>();
    return *secondContents_;
  }

  // 0 or the first errno; then nothing more is begun.
  int error() const { return error_.load(std::memory_order_relaxed); }
  void fail(int code) {
    int none = 0;
    error_.compare_exchange_strong(none, code, std::memory_order_relaxed);
  }

  // A file with several names, which the second thread has met: the first one knows the others.
  void putAside(std::shared_ptr<Directory> directory, const char* name) {
    const std::lock_guard lock(mutex_);
    putAside_.emplace_back(std::move(directory), name);
  }
  void copyPutAside();

 private:
  TreeCopier& owner_;
  FileContents& contents_;
  std::unique_ptr<FileContents> secondContents_;
  std::atomic<int> error_{0};
  std::mutex mutex_;
  std::vector<std::pair<std::shared_ptr<Directory>, const char*>> putAside_;
  SecondThread second_;
};

// One directory of the walk. Its files may be handed over; then it gets its attributes from whichever thread
// does its last part: writing into it changes its times, and it may become read-only.
class TreeCopier::Directory final : public DirectoryWork, public std::enable_shared_from_this<Directory> {
 public:
  Directory(Crew& crew, const struct stat& info, FileContents::Owner owner, std::string path)
      : crew_(crew), info_(info), owner_(owner), path_(std::move(path)) {}

  DirectoryNames names;
  std::vector<const char*> fileNames;

  const std::string& path() const { return path_; }  // below the top
  bool isHandedOver() const { return source_.isValid(); }

  // Takes descriptors of its own: the walk may give its own up before the files are done. 0 or errno.
  int prepareHandingOver(int source, int destination) {
    source_.reset(::fcntl(source, F_DUPFD_CLOEXEC, 0));
    destination_.reset(::fcntl(destination, F_DUPFD_CLOEXEC, 0));
    unfinished_ = fileNames.size() + 1;
    return source_.isValid() && destination_.isValid() ? 0 : errno;
  }
  // The walk will make nothing more in it.
  int walked(int source, int destination) {
    if (!isHandedOver()) return crew_.contents(false).copyAttributes(source, info_, destination, owner_);
    finishParts(1, crew_.contents(false));
    return crew_.error();
  }

  std::size_t files() const noexcept override { return fileNames.size(); }
  void work(bool isOnSecondThread) noexcept override {
    try {
      copyFiles(isOnSecondThread);
    } catch (const std::bad_alloc&) {
      crew_.fail(ENOMEM);
    }
  }
  void copySeveral(const char* name) {
    if (crew_.error() != 0) return;
    const int error = crew_.owner().copyAgain(source_.get(), destination_.get(), name, path_);
    if (error != 0) return crew_.fail(error);
    finishParts(1, crew_.contents(false));
  }

 private:
  void copyFiles(bool isOnSecondThread) {
    FileContents& contents = crew_.contents(isOnSecondThread);
    std::size_t done = 0;
    for (;;) {
      const std::size_t mine = next_.fetch_add(1, std::memory_order_relaxed);
      if (mine >= fileNames.size() || crew_.error() != 0) break;
      const char* const name = fileNames[mine];
      bool hasSeveralNames = false;
      const int error =
          crew_.owner().copyRegular(contents, source_.get(), destination_.get(), name, &hasSeveralNames);
      if (error != 0) return crew_.fail(error);
      if (!hasSeveralNames) {
        ++done;
      } else if (isOnSecondThread) {
        crew_.putAside(shared_from_this(), name);
      } else {
        copySeveral(name);
      }
    }
    if (done > 0) finishParts(done, contents);
  }
  void finishParts(std::size_t parts, FileContents& contents) {
    // Acquire and release: what the other thread made in the directory comes before its attributes.
    if (unfinished_.fetch_sub(parts, std::memory_order_acq_rel) != parts) return;
    const int error = contents.copyAttributes(source_.get(), info_, destination_.get(), owner_);
    if (error != 0) crew_.fail(error);
  }

  Crew& crew_;
  const struct stat info_;
  const FileContents::Owner owner_;
  const std::string path_;
  UniqueFd source_;
  UniqueFd destination_;
  std::atomic<std::size_t> next_{0};
  std::atomic<std::size_t> unfinished_{0};  // files, and the walk
};

struct TreeCopier::Level {
  HeldDirectory source;
  HeldDirectory destination;
  std::shared_ptr<Directory> directory;
};

void TreeCopier::Crew::copyPutAside() {
  for (;;) {
    std::pair<std::shared_ptr<Directory>, const char*> one;
    {
      const std::lock_guard lock(mutex_);
      if (putAside_.empty()) return;
      one = std::move(putAside_.back());
      putAside_.pop_back();
    }
    one.first->copySeveral(one.second);
  }
}

void TreeCopier::learnUmask(int directory) {
  // umask(2) can only be read by changing it, for all threads.
  const UniqueFd probe(::openat(directory, ".", O_TMPFILE | O_WRONLY | O_CLOEXEC, 0777));
  struct stat info {};
  if (probe.isValid() && ::fstat(probe.get(), &info) == 0) umask_ = 0777 & ~info.st_mode;
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

int TreeCopier::copyRegular(FileContents& contents, int from, int to, const char* name,
                            bool* hasSeveralNames) const {
  const UniqueFd file(::openat(from, name, kOpenFile));
  struct stat info {};
  if (!file.isValid() || ::fstat(file.get(), &info) != 0) return errno;
  if (!S_ISREG(info.st_mode)) return EBUSY;  // replaced under our hands
  if (const int error = checkRemovable(file.get(), ""); error != 0) return error;
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

// Copies a file or another item that may have been copied already under another name.
int TreeCopier::copyAgain(int from, int to, const char* name, const std::string& pathHere) {
  struct stat info {};
  if (::fstatat(from, name, &info, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (const int error = checkRemovable(from, name); error != 0) return error;
  if (info.st_nlink > 1) {
    const auto [known, isFirst] =
        linked_.try_emplace({info.st_dev, info.st_ino}, pathHere.empty() ? name : pathHere + "/" + name);
    // Where a second name cannot be had, a second copy has the same content.
    if (!isFirst && ::linkat(top_, known->second.c_str(), to, name, 0) == 0) return 0;
  }
  return S_ISREG(info.st_mode) ? copyRegular(contents_, from, to, name, nullptr)
                               : copySpecial(from, name, info, to, name);
}

int TreeCopier::copyEntries(Level& level, Crew& crew) {
  const std::shared_ptr<Directory>& directory = level.directory;
  const int from = level.source.get();
  const int to = level.destination.get();
  if (const int error = directory->names.load(from); error != 0) return error;
  std::vector<const char*> others;
  for (DirectoryNames::Entry entry{}; directory->names.next(&entry);) {
    if (entry.type == DT_REG) {
      directory->fileNames.push_back(entry.name);
    } else if (entry.type != DT_DIR) {
      others.push_back(entry.name);
    }
  }
  directory->names.rewind();
  if (crew.second().isWorth(directory->fileNames.size())) {
    if (const int error = directory->prepareHandingOver(from, to); error != 0) return error;
    crew.second().handOver(directory);
  } else {
    for (const char* name : directory->fileNames) {
      bool hasSeveralNames = false;
      const int error = copyRegular(contents_, from, to, name, &hasSeveralNames);
      if (error != 0) return error;
      if (hasSeveralNames) others.push_back(name);
    }
  }
  for (const char* name : others) {
    if (const int error = copyAgain(from, to, name, directory->path()); error != 0) return error;
  }
  crew.copyPutAside();
  return crew.error();
}

int TreeCopier::copyDirectoryInto(int source, const struct stat& info, int destination) {
  linked_.clear();
  top_ = destination;
  learnUmask(destination);
  struct stat top {};
  if (::fstat(destination, &top) != 0) return errno;
  Crew crew(*this, contents_);
  std::vector<Level> levels;
  const auto enter = [&](UniqueFd from, UniqueFd to, const struct stat& about, std::string path) {
    if (const int error = checkRemovable(from.get(), ""); error != 0) return error;
    // By way of another mount of the same file system the copy may come to stand inside its source.
    if (about.st_dev == top.st_dev && about.st_ino == top.st_ino) return EINVAL;
    if (levels.size() >= kHeldLevels) {
      Level& far = levels[levels.size() - kHeldLevels];
      if (const int error = far.source.giveUp(); error != 0) return error;
      if (const int error = far.destination.giveUp(); error != 0) return error;
    }
    const bool ownerFits = !levels.empty() && about.st_uid == ownUid_ && about.st_gid == ownGid_;
    const auto owner = ownerFits ? FileContents::Owner::asCreated : FileContents::Owner::asSource;
    levels.push_back({HeldDirectory(std::move(from)), HeldDirectory(std::move(to)),
                      std::make_shared<Directory>(crew, about, owner, std::move(path))});
    return copyEntries(levels.back(), crew);
  };
  {
    UniqueFd from(::openat(source, ".", kOpenDirectory));
    UniqueFd to(::openat(destination, ".", kOpenDirectory));
    if (!from.isValid() || !to.isValid()) return errno;
    if (const int error = enter(std::move(from), std::move(to), info, {}); error != 0) return error;
  }
  while (!levels.empty()) {
    Level& level = levels.back();
    DirectoryNames::Entry entry{};
    bool more = level.directory->names.next(&entry);
    while (more && entry.type != DT_DIR) more = level.directory->names.next(&entry);
    if (more) {
      struct stat about {};
      UniqueFd from(::openat(level.source.get(), entry.name, kOpenDirectory));
      if (!from.isValid() || ::fstat(from.get(), &about) != 0) return errno;
      if (::mkdirat(level.destination.get(), entry.name, 0700) != 0) return errno;
      UniqueFd to(::openat(level.destination.get(), entry.name, kOpenDirectory));
      if (!to.isValid()) return errno;
      std::string path = level.directory->path();
      if (!path.empty()) path += '/';
      path += entry.name;
      const int error = enter(std::move(from), std::move(to), about, std::move(path));
      if (error != 0) return error;
      continue;
    }
    const Level done = std::move(levels.back());
    levels.pop_back();
    if (!levels.empty()) {
      // Before the directory may become one that cannot be left by "..".
      if (const int error = levels.back().source.takeAgain(done.source.get()); error != 0) return error;
      const int error = levels.back().destination.takeAgain(done.destination.get());
      if (error != 0) return error;
    }
    const int error = done.directory->walked(done.source.get(), done.destination.get());
    if (error != 0) return error;
  }
  crew.second().drain();
  crew.copyPutAside();
  return crew.error();
}

}  // namespace brenvik
