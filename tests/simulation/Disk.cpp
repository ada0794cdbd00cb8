// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "Disk.h"

#include <dirent.h>
#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <memory>
#include <stdexcept>
#include <utility>

#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingAllocations.h"

// The calls as the C library has them, and as the helper's code makes them in this program; see
// CMakeLists.txt. The names are the linker's.
extern "C" {
// NOLINTBEGIN(bugprone-reserved-identifier)
int __real_fsync(int file);
int __real_fdatasync(int file);
int __real_syncfs(int file);
int __real_rename(const char* from, const char* to);
int __real_renameat(int fromFolder, const char* from, int toFolder, const char* to);
int __real_renameat2(int fromFolder, const char* from, int toFolder, const char* to, unsigned flags);
int __real_remove(const char* path);
int __real_unlinkat(int folder, const char* path, int flags);
int __real_mkdir(const char* path, mode_t mode);
int __real_mkdirat(int folder, const char* path, mode_t mode);
int __real_symlinkat(const char* target, int folder, const char* path);
int __real_linkat(int fromFolder, const char* from, int toFolder, const char* to, int flags);

using brenvik::simulation::Disk;

int __wrap_fsync(int file) {
  Disk::shared().beforeChange();
  const int result = __real_fsync(file);
  if (result == 0) Disk::shared().synced(file);
  return result;
}
int __wrap_fdatasync(int file) {
  Disk::shared().beforeChange();
  const int result = __real_fdatasync(file);
  if (result == 0) Disk::shared().synced(file);
  return result;
}
int __wrap_syncfs(int file) {
  Disk::shared().beforeChange();
  const int result = __real_syncfs(file);
  if (result == 0) Disk::shared().syncedAll();
  return result;
}
int __wrap_rename(const char* from, const char* to) {
  Disk::shared().beforeChange();
  return __real_rename(from, to);
}
int __wrap_renameat(int fromFolder, const char* from, int toFolder, const char* to) {
  Disk::shared().beforeChange();
  return __real_renameat(fromFolder, from, toFolder, to);
}
int __wrap_renameat2(int fromFolder, const char* from, int toFolder, const char* to, unsigned flags) {
  Disk::shared().beforeChange();
  return __real_renameat2(fromFolder, from, toFolder, to, flags);
}
int __wrap_remove(const char* path) {
  Disk::shared().beforeChange();
  return __real_remove(path);
}
int __wrap_unlinkat(int folder, const char* path, int flags) {
  Disk::shared().beforeChange();
  return __real_unlinkat(folder, path, flags);
}
int __wrap_mkdir(const char* path, mode_t mode) {
  Disk::shared().beforeChange();
  return __real_mkdir(path, mode);
}
int __wrap_mkdirat(int folder, const char* path, mode_t mode) {
  Disk::shared().beforeChange();
  return __real_mkdirat(folder, path, mode);
}
int __wrap_symlinkat(const char* target, int folder, const char* path) {
  Disk::shared().beforeChange();
  return __real_symlinkat(target, folder, path);
}
int __wrap_linkat(int fromFolder, const char* from, int toFolder, const char* to, int flags) {
  Disk::shared().beforeChange();
  return __real_linkat(fromFolder, from, toFolder, to, flags);
}
// NOLINTEND(bugprone-reserved-identifier)
}

namespace brenvik::simulation {
namespace {

namespace fs = std::filesystem;

void require(bool isDone, const char* what) {
  if (!isDone) throw std::runtime_error(std::string(what) + ": " + std::strerror(errno));
}

std::string contentOf(const std::string& path) {
  const UniqueFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  std::string content;
  std::array<char, 4096> buffer;
  for (ssize_t got = 0; (got = ::read(file.get(), buffer.data(), buffer.size())) > 0;) {
    content.append(buffer.data(), static_cast<std::size_t>(got));
  }
  return content;
}

// The item at the path; a mode of 0 when there is none.
std::pair<ino_t, Item> itemAt(const std::string& path) {
  struct stat facts {};
  if (::lstat(path.c_str(), &facts) != 0) return {};
  Item item{facts.st_mode, {}, facts.st_uid, facts.st_gid};
  if (S_ISREG(facts.st_mode)) item.content = contentOf(path);
  if (S_ISLNK(facts.st_mode)) item.content = fs::read_symlink(path).string();
  return {facts.st_ino, item};
}

// What is below the root, however the root is named, but for /proc.
bool isOurs(const std::filesystem::path& path) {
  if (path.filename() != "proc") return true;
  struct stat root {};
  struct stat item {};
  return ::stat("/", &root) == 0 && ::lstat(path.c_str(), &item) == 0 && root.st_dev == item.st_dev;
}

std::string below(const std::string& folder, const std::string& name) {
  return (folder == "/" ? "" : folder) + "/" + name;
}

void readBelow(const std::string& folder, Tree& tree) {
  for (const auto& each : fs::directory_iterator(folder)) {
    const std::string path = each.path().string();
    if (!isOurs(path)) continue;
    Item item = itemAt(path).second;
    const bool isDirectory = S_ISDIR(item.mode);
    tree.emplace(path, std::move(item));
    if (isDirectory) readBelow(path, tree);
  }
}

}  // namespace

Disk& Disk::shared() {
  static Disk disk;
  return disk;
}

void Disk::enter() {
  require(::unshare(CLONE_NEWNS) == 0, "a mount namespace");
  require(::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0, "private mounts");
  const std::string root = fs::temp_directory_path().string();
  require(::mount("simulation", root.c_str(), "tmpfs", 0, "mode=0755,size=64m") == 0, "a tmpfs");
  fs::create_directory(root + "/proc");
  require(::mount("/proc", (root + "/proc").c_str(), nullptr, MS_BIND | MS_REC, nullptr) == 0, "/proc");
  require(::chroot(root.c_str()) == 0 && ::chdir("/") == 0, "a root of its own");
}

void Disk::restore(const Tree& tree) {
  stopCounting();
  for (const auto& each : fs::directory_iterator("/")) {
    if (isOurs(each.path())) fs::remove_all(each.path());
  }
  for (const auto& [path, item] : tree) {  // in order of the paths: a folder before what is in it
    if (S_ISDIR(item.mode)) {
      require(__real_mkdir(path.c_str(), 0700) == 0, "a folder of the tree");
    } else if (S_ISLNK(item.mode)) {
      fs::create_symlink(item.content, path);
    } else {
      const UniqueFd file(::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
      require(::write(file.get(), item.content.data(), item.content.size()) ==
                  static_cast<ssize_t>(item.content.size()),
              "a file of the tree");
    }
    require(::lchown(path.c_str(), item.uid, item.gid) == 0, "an owner");
    if (!S_ISLNK(item.mode)) require(::chmod(path.c_str(), item.mode & 07777) == 0, "a mode");
  }
  syncedAll();
}

Tree Disk::read() const {
  Tree tree;
  readBelow("/", tree);
  return tree;
}

void Disk::beforeChange() {
  const FailingAllocations::Pause pause;
  if (left_ > 0 && --left_ == 0) std::exchange(then_, {})();
}

Disk::Names Disk::namesIn(const std::string& path) {
  Names names;
  for (const auto& each : fs::directory_iterator(path)) {
    if (!isOurs(each.path())) continue;
    auto [inode, item] = itemAt(each.path().string());
    names.emplace(each.path().filename().string(), Name{inode, std::move(item)});
  }
  return names;
}

void Disk::synced(int file) {
  const FailingAllocations::Pause pause;
  struct stat facts {};
  if (::fstat(file, &facts) != 0) return;
  const std::string path = "/proc/self/fd/" + std::to_string(file);
  Inode& inode = synced_[facts.st_ino];
  inode.item = {facts.st_mode, {}, facts.st_uid, facts.st_gid};
  if (S_ISREG(facts.st_mode)) inode.item.content = contentOf(path);
  if (S_ISDIR(facts.st_mode)) inode.names = namesIn(path + "/.");
}

void Disk::syncBelow(const std::string& path) {
  auto [inode, item] = itemAt(path);
  Inode& known = synced_[inode];
  known.item = item;
  known.names.clear();
  if (!S_ISDIR(item.mode)) return;
  known.names = namesIn(path);
  const Names names = known.names;
  for (const auto& [name, each] : names) syncBelow(below(path, name));
}

void Disk::syncedAll() {
  const FailingAllocations::Pause pause;
  synced_.clear();
  syncBelow("/");
}

// ---- a power cut ----

class Disk::Cut {
 public:
  Cut(const Disk& disk, Random& random) : disk_(disk), random_(random) { find("/"); }

  Tree tree() {
    const auto [root, item] = itemAt("/");
    group();
    take(root, "/");
    return std::move(tree_);
  }

 private:
  // Where each folder is now, with its names.
  void find(const std::string& path) {
    const auto [inode, item] = itemAt(path);
    Names names = namesIn(path);
    for (const auto& [name, each] : names) {
      if (S_ISDIR(each.item.mode)) find(below(path, name));
    }
    now_.emplace(inode, std::move(names));
  }

  ino_t groupOf(ino_t inode) {
    while (groups_.contains(inode) && groups_[inode] != inode) inode = groups_[inode];
    return inode;
  }
  Names before(ino_t folder) const {
    const auto found = disk_.synced_.find(folder);
    return found == disk_.synced_.end() ? Names() : found->second.names;
  }
  Names after(ino_t folder) const {
    const auto found = now_.find(folder);
    return found == now_.end() ? before(folder) : found->second;
  }
  // What stood and what stands under one name goes or stays together.
  void group() {
    for (const auto& [folder, names] : now_) {
      for (const auto& [name, was] : before(folder)) {
        const auto is = names.find(name);
        if (is == names.end() || is->second == was) continue;
        groups_.try_emplace(was.inode, was.inode);
        groups_.try_emplace(is->second.inode, is->second.inode);
        groups_[groupOf(was.inode)] = groupOf(is->second.inode);
      }
    }
  }
  // Whether what has become of this item's name got to the disk.
  bool isNew(ino_t inode) {
    const auto [found, isFirst] = chosen_.try_emplace(groupOf(inode), false);
    if (isFirst) found->second = random_.oneIn(2);
    return found->second;
  }

  void take(ino_t folder, const std::string& path) {
    const Names was = before(folder);
    const Names is = after(folder);
    Names names;
    for (const auto& [name, each] : was) {
      const auto there = is.find(name);
      const bool isSame = there != is.end() && there->second == each;
      if (isSame || !isNew(each.inode)) names.emplace(name, each);
    }
    for (const auto& [name, each] : is) {
      const auto there = was.find(name);
      const bool isSame = there != was.end() && there->second == each;
      if (isSame || isNew(each.inode)) names.insert_or_assign(name, each);
    }
    for (const auto& [name, each] : names) put(below(path, name), each);
  }

  void put(const std::string& path, const Name& name) {
    Item item = name.item;
    const auto known = disk_.synced_.find(name.inode);
    if (S_ISREG(item.mode)) {
      const std::string old = known != disk_.synced_.end() ? known->second.item.content : std::string();
      const std::string now = currentContent(name);
      if (known != disk_.synced_.end() && random_.oneIn(2)) item = known->second.item;
      item.content = now == old ? now : mixture(old, now);
    } else if (S_ISDIR(item.mode) && known != disk_.synced_.end() && random_.oneIn(2)) {
      item = known->second.item;
    }
    tree_.emplace(path, std::move(item));
    if (S_ISDIR(name.item.mode)) take(name.inode, path);
  }
  std::string currentContent(const Name& name) const {
    for (const auto& [folder, names] : now_) {
      for (const auto& [text, each] : names) {
        if (each.inode == name.inode) return each.item.content;
      }
    }
    return name.item.content;
  }
  std::string mixture(const std::string& old, const std::string& now) {
    switch (random_.below(3)) {
      case 0:
        return old;
      case 1:
        return now;
      default:
        return now.substr(0, random_.below(now.size() + 1));
    }
  }

  const Disk& disk_;
  Random& random_;
  std::map<ino_t, Names> now_;
  std::map<ino_t, ino_t> groups_;
  std::map<ino_t, bool> chosen_;
  Tree tree_;
};

Tree Disk::afterPowerCut(Random& random) const { return Cut(*this, random).tree(); }

}  // namespace brenvik::simulation
