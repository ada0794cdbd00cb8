// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/LinuxFileManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <grp.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <new>

#include "platform/base/Guarded.h"
#include "platform/base/PasswordEntry.h"
#include "platform/base/WriteAll.h"
#include "platform/files/linux/DirectoryNames.h"
#include "platform/files/linux/Durability.h"
#include "platform/files/linux/FileContents.h"
#include "platform/files/linux/Placement.h"
#include "platform/files/linux/TreeCopier.h"
#include "platform/files/linux/TreeRemover.h"
#include "platform/files/linux/TreeWalk.h"

namespace brenvik {
namespace {

// Runs `work`, which returns 0 or an errno value.
template <typename Work>
FileOutcome outcomeOf(Work work) noexcept {
  const int error = guarded(ENOMEM, work);
  return error == 0 ? FileOutcome::success() : FileOutcome::failure(error);
}

bool isSameItem(const struct stat& a, const struct stat& b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

// Whether `directory` is `tree` or lies below it. Yes, too, when that cannot be found out.
bool isInside(int directory, const struct stat& tree) {
  struct stat here {};
  if (::fstat(directory, &here) != 0) return true;
  UniqueFd current;
  for (int at = directory; !isSameItem(here, tree);) {
    UniqueFd parent(::openat(at, "..", O_PATH | O_DIRECTORY | O_CLOEXEC));
    struct stat above {};
    if (!parent.isValid() || ::fstat(parent.get(), &above) != 0) return true;
    if (isSameItem(here, above)) return false;  // the root is its own parent
    here = above;
    current = std::move(parent);
    at = current.get();
  }
  return true;
}

int idOfUser(std::string_view name, uid_t* uid) {
  std::optional<PasswordEntry> entry;
  const int error = readPasswordEntry(std::string(name).c_str(), &entry);
  if (!entry) return error != 0 ? error : EINVAL;
  *uid = entry->uid;
  return 0;
}

int idOfGroup(std::string_view name, gid_t* gid) {
  std::string buffer(4096, '\0');
  group entry{};
  group* found = nullptr;
  int error = 0;
  const std::string text(name);
  // A group of many members needs more room than any fixed size.
  while ((error = ::getgrnam_r(text.c_str(), &entry, buffer.data(), buffer.size(), &found)) == ERANGE &&
         buffer.size() < (1 << 20)) {
    buffer.resize(buffer.size() * 2);
  }
  if (found == nullptr) return error != 0 ? error : EINVAL;
  *gid = found->gr_gid;
  return 0;
}

bool isDirectory(const std::string& path) {
  struct stat info {};
  return ::stat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
}

UniqueFd openForNames(int directory) {
  return UniqueFd(::openat(directory, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

// Of the descriptor's own item: `item` may be one of O_PATH, of a link as well. 0 or errno.
int apply(const ItemAttributes& attributes, int item, const struct stat& info) {
  const bool isLink = S_ISLNK(info.st_mode);
  const uid_t uid = attributes.uid.value_or(info.st_uid);
  // A link's owner says who put it there, and root's are followed: somebody else's does not become one of
  // them.
  if (isLink && uid != info.st_uid && (uid == 0 || uid == ::geteuid())) return 0;
  if (attributes.uid || attributes.gid) {
    if (::fchownat(item, "", uid, attributes.gid.value_or(info.st_gid), AT_EMPTY_PATH) != 0) return errno;
  }
  if (!attributes.mode || isLink) return 0;
  char self[32];
  (void)std::snprintf(self, sizeof self, "/proc/self/fd/%d", item);
  return ::chmod(self, *attributes.mode & 07777) == 0 ? 0 : errno;
}

bool has(const struct stat& info, const ItemAttributes& attributes) {
  return attributes.uid.value_or(info.st_uid) == info.st_uid &&
         attributes.gid.value_or(info.st_gid) == info.st_gid &&
         (S_ISLNK(info.st_mode) || attributes.mode.value_or(info.st_mode & 07777) == (info.st_mode & 07777));
}

// Opens an item to give it the attributes. `folder`: of the directory it was found in, as it is or as it was.
// 0 or errno.
int openToChange(int directory, const char* name, const struct stat& folder, const ItemAttributes& attributes,
                 UniqueFd* item, struct stat* info) {
  item->reset(::openat(directory, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (!item->isValid() || ::fstat(item->get(), info) != 0) return errno;
  // An account that may write to a directory can put a hard link to somebody else's file into it.
  const bool hasOtherNames = !S_ISDIR(info->st_mode) && info->st_nlink > 1;
  const bool isFromElsewhere = info->st_uid != folder.st_uid || (folder.st_mode & 0022) != 0;
  return hasOtherNames && isFromElsewhere && !has(*info, attributes) ? EPERM : 0;
}

class EnumeratingWalk final : private TreeWalk {
 public:
  explicit EnumeratingWalk(ItemVisitor& visitor) : visitor_(visitor) {}
  int run(UniqueFd directory) {
    Level top;
    top.directory = HeldDirectory(std::move(directory));
    const int error = walk(std::move(top));
    return first_ != 0 ? first_ : error;
  }

 private:
  int visit(Level&, const DirectoryNames::Entry& entry, bool* descend) override {
    const bool isDirectory = entry.type == DT_DIR;
    *descend = visitor_.visit(path(), isDirectory) == ItemVisitor::Next::descend && isDirectory;
    return 0;
  }
  int cannotEnter(Level&, const char*, int error) override {
    // ENOENT: the visitor took it away, or somebody else did.
    if (first_ == 0 && error != ENOENT) first_ = error;
    return 0;
  }

  ItemVisitor& visitor_;
  int first_ = 0;
};

class ChangingWalk final : private TreeWalk {
 public:
  explicit ChangingWalk(const ItemAttributes& attributes) : attributes_(attributes) {}
  // 0, or the last errno.
  int run(int directory, const struct stat& info) {
    Level top;
    top.directory = HeldDirectory(openForNames(directory));
    top.info = info;
    if (top.directory.get() < 0) return 0;  // what cannot be listed has no items to change
    const int error = walk(std::move(top));
    return error != 0 ? error : last_;
  }

 private:
  int visit(Level& level, const DirectoryNames::Entry& entry, bool* descend) override {
    UniqueFd item;
    int error = openToChange(level.directory.get(), entry.name, level.info, attributes_, &item, &before_);
    if (error == 0) error = apply(attributes_, item.get(), before_);
    if (error != 0) last_ = error;
    *descend = item.isValid() && S_ISDIR(before_.st_mode);
    return 0;
  }
  int opened(Level&, Level& below) override {
    if (::fstat(below.directory.get(), &below.info) != 0) return errno;
    // The owner that it had when its names were put there. Another may stand in its place by now.
    if (isSameItem(below.info, before_)) below.info = before_;
    return 0;
  }
  int cannotEnter(Level&, const char*, int) override { return 0; }  // as for the top

  const ItemAttributes& attributes_;
  struct stat before_ {};  // of the last item visited
  int last_ = 0;
};

}  // namespace

struct LinuxFileManager::ResolvedAttributes {
  mode_t mode;
  uid_t uid = static_cast<uid_t>(-1);
  gid_t gid = static_cast<gid_t>(-1);
};

void LinuxFileManager::closeScope() noexcept {
  if (--scopes_ != 0) return;
  contents_.reset();
  cleared_.clear();
}

void LinuxFileManager::removeLeftoversOnce(const Place& place) {
  if (scopes_ > 0) {
    // Once for each folder of a request: a merge comes to the same one for every file.
    struct stat info {};
    if (::fstat(place.directory.get(), &info) != 0) return;
    if (!cleared_.emplace(info.st_dev, info.st_ino).second) return;
  }
  removeLeftovers(place.directory.get());
}

// 0 or errno, as Place::open().
int LinuxFileManager::openPlace(const std::string& path, Place* place) {
  if (const int error = Place::open(path, place); error != 0) return error;
  removeLeftoversOnce(*place);
  return 0;
}

// Makes one directory with exactly these attributes. It shows under its name only with them: a directory in
// the making would be taken for the finished one by the next call.
int LinuxFileManager::makeDirectory(const std::string& path, const ResolvedAttributes& attributes) {
  Place place;
  if (const int error = openPlace(path, &place); error != 0) return error;
  struct stat there {};
  if (::fstatat(place.directory.get(), place.name.c_str(), &there, AT_SYMLINK_NOFOLLOW) == 0) return EEXIST;
  Stage stage(place);
  if (const int error = stage.makeDirectory(); error != 0) return error;
  const bool giveAway = attributes.uid != static_cast<uid_t>(-1) || attributes.gid != static_cast<gid_t>(-1);
  if (giveAway && ::fchown(stage.get(), attributes.uid, attributes.gid) != 0) return errno;
  if (::fchmod(stage.get(), attributes.mode & 07777) != 0) return errno;
  if (const int error = stage.publish(IfPresent::fail); error != 0) return error;
  return syncNames(place.directory.get());
}

int LinuxFileManager::makeDirectories(const std::string& path, const ResolvedAttributes& attributes) {
  const int error = makeDirectory(path, attributes);
  if (error == 0 || isDirectory(path)) return 0;
  struct stat info {};
  const bool isMissing = ::lstat(path.c_str(), &info) != 0 && errno == ENOENT;
  // "missing/." is said to be there: it names a directory by itself.
  if (error != ENOENT && !(error == EEXIST && isMissing)) return error;
  // From the first directory that is missing, down.
  for (std::size_t slash = path.find('/', 1); slash != std::string::npos; slash = path.find('/', slash + 1)) {
    const std::string above = path.substr(0, slash);
    if (::stat(above.c_str(), &info) == 0) continue;
    if (const int failed = makeDirectory(above, attributes); failed != 0 && failed != EEXIST) return failed;
  }
  const int last = makeDirectory(path, attributes);
  return last == EEXIST && isDirectory(path) ? 0 : last;  // "a/b/" was made by the loop
}

FileContents& LinuxFileManager::contents() {
  if (!contents_ || scopes_ == 0) contents_ = std::make_unique<FileContents>();
  return *contents_;
}

bool LinuxFileManager::itemExists(const std::string& path, bool* isDirectory) noexcept {
  struct stat info {};
  const bool exists = outcomeOf([&] {
                        UniqueFd item;
                        if (const int error = openToRead(path, O_PATH, &item); error != 0) return error;
                        return ::fstat(item.get(), &info) == 0 ? 0 : errno;
                      }).succeeded();
  if (isDirectory != nullptr) *isDirectory = exists && S_ISDIR(info.st_mode);
  return exists;
}

// Gives the item to the gift's owner and notes how that went.
void LinuxFileManager::give(int item, Gift* gift) {
  if (gift == nullptr) return;
  struct stat made {};
  const int error = ::fstat(item, &made) != 0 ? errno : apply(gift->attributes, item, made);
  gift->outcome = error == 0 ? FileOutcome::success() : FileOutcome::failure(error);
}

// Copies a link, a pipe, a socket or a device into the stage. 0 or errno.
int LinuxFileManager::stageSpecial(TreeCopier& copier, const Place& from, const struct stat& info,
                                   Stage& stage, Gift* gift) {
  if (const int error = stage.makeRoom(); error != 0) return error;
  const int room = stage.room();
  const int error =
      copier.copySpecial(from.directory.get(), from.name.c_str(), info, room, Stage::itemName());
  if (error != 0) return error;
  const UniqueFd made(::openat(room, Stage::itemName(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  give(made.get(), gift);
  return 0;
}

// Copies an opened file or directory into the stage. 0 or errno.
int LinuxFileManager::stageContents(TreeCopier& copier, int item, const struct stat& info, const Place& to,
                                    Stage& stage) {
  if (S_ISDIR(info.st_mode)) {
    if (isInside(to.directory.get(), info)) return EINVAL;
    const int error = stage.makeDirectory();
    return error != 0 ? error : copier.copyDirectoryInto(item, info, stage.get());
  }
  if (!S_ISREG(info.st_mode)) return EBUSY;
  const int error = stage.makeFile();
  return error != 0 ? error : copier.copyFileInto(item, info, stage.get());
}

// Makes a copy of the item in the stage. With Durability::onReturn everything but the copy's name is on the
// disk then. *info is the item's; afterwards it is that of what was opened. Returns 0 or errno. Whether the
// gift was given is the gift's own outcome.
int LinuxFileManager::stageCopy(const Place& from, struct stat* info, const Place& to, Stage& stage,
                                TreeCopier::Source afterwards, Durability durability, Gift* gift) {
  TreeCopier copier(contents(), ::geteuid(), ::getegid(), afterwards);
  const bool isDirectory = S_ISDIR(info->st_mode);
  if (!isDirectory && !S_ISREG(info->st_mode)) return stageSpecial(copier, from, *info, stage, gift);
  const UniqueFd item(
      ::openat(from.directory.get(), from.name.c_str(),
               O_RDONLY | O_NOFOLLOW | O_CLOEXEC | (isDirectory ? O_DIRECTORY : O_NONBLOCK | O_NOCTTY)));
  if (!item.isValid() || ::fstat(item.get(), info) != 0) return errno;
  if (const int error = stageContents(copier, item.get(), *info, to, stage); error != 0) return error;
  give(stage.get(), gift);
  if (durability == Durability::eventual) return 0;
  return isDirectory ? syncFileSystem(stage.get()) : syncFile(stage.get());
}

int LinuxFileManager::copy(const std::string& source, const std::string& destination, IfPresent ifPresent,
                           Durability durability, Gift* gift) {
  Place from;
  struct stat info {};
  if (const int error = Place::openExisting(source, &from, Links::own); error != 0) return error;
  if (::fstatat(from.directory.get(), from.name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  Place place;
  if (const int error = openPlace(destination, &place); error != 0) return error;
  struct stat there {};
  const bool present = ::fstatat(place.directory.get(), place.name.c_str(), &there, AT_SYMLINK_NOFOLLOW) == 0;
  if (present && (ifPresent == IfPresent::fail || S_ISDIR(there.st_mode))) return EEXIST;

  Stage stage(place);
  const int error = stageCopy(from, &info, place, stage, TreeCopier::Source::stays, durability, gift);
  if (error != 0) return error;
  if (const int failed = stage.publish(ifPresent); failed != 0) return failed;
  return durability == Durability::onReturn ? syncNames(place.directory.get()) : 0;
}

// To another file system. In the end the item is whole at one of the two places, and only there.
int LinuxFileManager::moveAcross(const Place& from, const Place& to, IfPresent ifPresent) {
  struct stat info {};
  struct stat there {};
  if (::fstatat(from.directory.get(), from.name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  const bool present = ::fstatat(to.directory.get(), to.name.c_str(), &there, AT_SYMLINK_NOFOLLOW) == 0;
  if (present && (ifPresent == IfPresent::fail || S_ISDIR(there.st_mode))) return EEXIST;

  // The source goes into a room beside it in one step. Made first: where nothing can be made, nothing can be
  // removed.
  Stage away(from);
  const int noRoom = away.makeRoom();
  const bool isFull = noRoom == ENOSPC || noRoom == EDQUOT;  // perhaps that is why it is to be moved
  if (noRoom != 0 && !isFull) return noRoom;

  Stage stage(to, Stage::Undo::possible);
  if (const int error = stageCopy(from, &info, to, stage, TreeCopier::Source::goes, Durability::onReturn);
      error != 0) {
    return error;
  }
  if (const int error = stage.publish(ifPresent); error != 0) return error;
  int error = syncNames(to.directory.get());
  if (error == 0 && isFull) {
    if (const int failed = removeTree(from.directory.get(), from.name.c_str()); failed != 0) return failed;
  } else if (error == 0) {
    error = away.take(info);
  }
  if (error == 0) return syncNames(from.directory.get());
  // The copy goes, and with it the names that wait for the disk. The first failure is the answer.
  if (stage.takeBack() == 0) (void)syncNames(to.directory.get());
  return error;
}

namespace {

int renamed(const Place& from, const Place& to) {
  return ::renameat(from.directory.get(), from.name.c_str(), to.directory.get(), to.name.c_str()) == 0
             ? 0
             : errno;
}

int renamedWith(unsigned flags, const Place& from, const Place& to) {
  return ::renameat2(from.directory.get(), from.name.c_str(), to.directory.get(), to.name.c_str(), flags) == 0
             ? 0
             : errno;
}

int statOf(const Place& place, struct stat* info) {
  return ::fstatat(place.directory.get(), place.name.c_str(), info, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
}

int unlinked(const Place& place) {
  return ::unlinkat(place.directory.get(), place.name.c_str(), 0) == 0 ? 0 : errno;
}

// Renames unless something stands at the new place. 0 or errno: EEXIST when something does.
int renameToFreePlace(const Place& from, const Place& to) {
  const int error = renamedWith(RENAME_NOREPLACE, from, to);
  if (error != EINVAL && error != ENOSYS) return error;
  // A file system without the flag, or a directory into itself, which the plain call refuses as well.
  struct stat there {};
  return statOf(to, &there) == 0 ? EEXIST : renamed(from, to);
}

// Two names of one file: the old one goes. 0 or errno.
int dropOtherName(const Place& from, const Place& to) {
  // rename(2) leaves two names of one file alone. They may even be one name.
  struct stat a {};
  struct stat b {};
  if (::fstat(from.directory.get(), &a) != 0 || ::fstat(to.directory.get(), &b) != 0) return errno;
  return from.name == to.name && isSameItem(a, b) ? 0 : unlinked(from);
}

// Renames onto what stands at the new place, which is not a directory. `info`: of the item. 0 or errno:
// EEXIST when it is a directory.
int renameOnto(const Place& from, const struct stat& info, const Place& to) {
  struct stat there {};
  if (const int error = statOf(to, &there); error != 0) return error;
  if (S_ISDIR(there.st_mode)) return EEXIST;
  if (isSameItem(info, there)) return dropOtherName(from, to);
  if (!S_ISDIR(info.st_mode)) return renamed(from, to);
  // A directory replaces no file by rename(2), so the two change places first.
  const int error = renamedWith(RENAME_EXCHANGE, from, to);
  return error != 0 ? error : unlinked(from);
}

}  // namespace

int LinuxFileManager::move(const std::string& source, const std::string& destination, IfPresent ifPresent,
                           Durability durability) {
  Place from;
  Place to;
  // EEXIST: "." and ".." name no entry that could be taken away.
  if (const int error = openPlace(source, &from); error != 0) return error == EEXIST ? EBUSY : error;
  if (const int error = openPlace(destination, &to); error != 0) return error;
  struct stat info {};
  if (const int error = statOf(from, &info); error != 0) return error;
  if (!S_ISDIR(info.st_mode) && (source.ends_with('/') || destination.ends_with('/'))) return ENOTDIR;

  int error = renameToFreePlace(from, to);
  if (error == EEXIST && ifPresent == IfPresent::replaceNonDirectory) error = renameOnto(from, info, to);
  if (error == EXDEV) return moveAcross(from, to, ifPresent);
  if (error != 0 || durability == Durability::eventual) return error;
  // The new name first: a power cut in between leaves both, and not none.
  if (const int failed = syncNames(to.directory.get()); failed != 0) return failed;
  return syncNames(from.directory.get());
}

FileOutcome LinuxFileManager::copyItem(const std::string& source, const std::string& destination,
                                       IfPresent ifPresent, Durability durability, Gift* gift) noexcept {
  const FileOutcome outcome =
      outcomeOf([&] { return copy(source, destination, ifPresent, durability, gift); });
  if (gift != nullptr && !outcome.succeeded()) gift->outcome = outcome;
  return outcome;
}

FileOutcome LinuxFileManager::moveItem(const std::string& source, const std::string& destination,
                                       IfPresent ifPresent, Durability durability) noexcept {
  return outcomeOf([&] { return move(source, destination, ifPresent, durability); });
}

FileOutcome LinuxFileManager::removeItem(const std::string& path) noexcept {
  return outcomeOf([&] {
    Place place;
    const int error = Place::open(path, &place);
    return error != 0 ? error : removeTree(place.directory.get(), place.name.c_str());
  });
}

FileOutcome LinuxFileManager::removeEntry(const std::string& path) noexcept {
  return outcomeOf([&] {
    Place place;
    if (const int error = openPlace(path, &place); error != 0) return error;
    const int directory = place.directory.get();
    const char* const name = place.name.c_str();
    struct stat info {};
    if (::fstatat(directory, name, &info, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    const bool isDirectoryThere = S_ISDIR(info.st_mode);
    if (path.ends_with('/') && !isDirectoryThere) return ENOTDIR;
    if (::unlinkat(directory, name, isDirectoryThere ? AT_REMOVEDIR : 0) != 0) return errno;
    return syncNames(directory);
  });
}

FileOutcome LinuxFileManager::placeLink(const std::string& path, const std::string& target) noexcept {
  return outcomeOf([&] {
    if (path.ends_with('/')) return ENOTDIR;  // no link has such a name
    Place place;
    if (const int error = openPlace(path, &place); error != 0) return error;
    if (const int error = brenvik::placeLink(place, target); error != 0) return error;
    return syncNames(place.directory.get());
  });
}

FileOutcome LinuxFileManager::syncItem(const std::string& path) noexcept {
  return outcomeOf([&] {
    Place place;
    if (const int error = Place::openExisting(path, &place, Links::unchangeable); error != 0) return error;
    struct stat info {};
    if (::fstatat(place.directory.get(), place.name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    if (S_ISREG(info.st_mode) || S_ISDIR(info.st_mode)) {
      const UniqueFd item(::openat(place.directory.get(), place.name.c_str(),
                                   O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
      if (!item.isValid()) return errno;
      const int error = S_ISDIR(info.st_mode) ? syncFileSystem(item.get()) : syncFile(item.get());
      if (error != 0) return error;
    }
    return syncNames(place.directory.get());
  });
}

FileOutcome LinuxFileManager::createDirectory(const std::string& path, const DirectoryAttributes& attributes,
                                              Intermediates intermediates) noexcept {
  return outcomeOf([&] {
    ResolvedAttributes resolved{attributes.mode & 07777};
    if (!attributes.ownerName.empty()) {
      if (const int error = idOfUser(attributes.ownerName, &resolved.uid); error != 0) return error;
    }
    if (!attributes.groupName.empty()) {
      if (const int error = idOfGroup(attributes.groupName, &resolved.gid); error != 0) return error;
    }
    return intermediates == Intermediates::create ? makeDirectories(path, resolved)
                                                  : makeDirectory(path, resolved);
  });
}

FileOutcome LinuxFileManager::listDirectory(const std::string& path,
                                            std::vector<std::string>* names) noexcept {
  return outcomeOf([&] {
    UniqueFd directory;
    if (const int error = openToRead(path, O_RDONLY | O_DIRECTORY, &directory); error != 0) return error;
    DirectoryNames entries;
    if (const int error = entries.load(directory.get()); error != 0) return error;
    DirectoryNames::Entry entry{};
    while (entries.next(&entry)) names->emplace_back(entry.name);
    return 0;
  });
}

FileOutcome LinuxFileManager::enumerateBelow(const std::string& path, ItemVisitor& visitor) noexcept {
  return outcomeOf([&] {
    UniqueFd top;
    if (const int error = openDirectory(path, &top, Links::own); error != 0) return error;
    UniqueFd names = openForNames(top.get());
    return names.isValid() ? EnumeratingWalk(visitor).run(std::move(names)) : errno;
  });
}

// Of the item at the path, and of everything below it first if that is asked for. 0 or errno.
int LinuxFileManager::change(const std::string& path, const ItemAttributes& attributes, ItemKinds kinds,
                             Reach reach) {
  Place place;
  if (const int error = Place::openExisting(path, &place, Links::unchangeable); error != 0) return error;
  struct stat folder {};
  struct stat info {};
  UniqueFd item;
  if (::fstat(place.directory.get(), &folder) != 0) return errno;
  const int refused =
      openToChange(place.directory.get(), place.name.c_str(), folder, attributes, &item, &info);
  if (refused != 0) return refused;
  if (kinds == ItemKinds::noFiles && S_ISREG(info.st_mode)) return EINVAL;
  const bool hasBelow = reach == Reach::tree && S_ISDIR(info.st_mode);
  const int below = hasBelow ? ChangingWalk(attributes).run(item.get(), info) : 0;
  const int top = apply(attributes, item.get(), info);
  return top != 0 ? top : below;
}

FileOutcome LinuxFileManager::setAttributes(const std::string& path, const ItemAttributes& attributes,
                                            ItemKinds kinds) noexcept {
  return outcomeOf([&] { return change(path, attributes, kinds, Reach::item); });
}

FileOutcome LinuxFileManager::setAttributesOfTree(const std::string& path,
                                                  const ItemAttributes& attributes) noexcept {
  return outcomeOf([&] { return change(path, attributes, ItemKinds::all, Reach::tree); });
}

namespace {

// All of the file, which says that it has `size` bytes; nothing when it has more than `limit` or cannot be
// read.
std::optional<std::string> readAll(int file, std::size_t size, std::size_t limit) {
  std::string bytes;
  // One byte more than it should have: the read that gets nothing ends it. Some files say they are empty.
  std::size_t length = 0;
  bytes.resize(size + 1);
  for (;;) {
    if (length == bytes.size()) {
      if (length > limit) return std::nullopt;
      bytes.resize(length + 65536);
    }
    const ssize_t got = ::read(file, bytes.data() + length, bytes.size() - length);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return std::nullopt;
    if (got == 0) break;
    length += static_cast<std::size_t>(got);
  }
  if (length > limit) return std::nullopt;
  bytes.resize(length);
  return bytes;
}

}  // namespace

std::optional<std::string> LinuxFileManager::readFile(const std::string& path, std::size_t limit) noexcept {
  return guarded(std::optional<std::string>(), [&]() -> std::optional<std::string> {
    UniqueFd file;
    struct stat info {};
    if (openToRead(path, O_RDONLY | O_NONBLOCK | O_NOCTTY, &file) != 0) return std::nullopt;
    if (::fstat(file.get(), &info) != 0 || !S_ISREG(info.st_mode)) return std::nullopt;
    const auto size = static_cast<std::size_t>(info.st_size);
    return size > limit ? std::nullopt : readAll(file.get(), size, limit);
  });
}

bool LinuxFileManager::writeFileAtomically(const std::string& path, std::string_view bytes) noexcept {
  return outcomeOf([&] {
           Place place;
           if (const int error = openPlace(path, &place); error != 0) return error;
           struct stat there {};
           const bool keep =
               ::fstatat(place.directory.get(), place.name.c_str(), &there, AT_SYMLINK_NOFOLLOW) == 0 &&
               S_ISREG(there.st_mode);
           Stage stage(place);
           if (const int error = stage.makeFile(); error != 0) return error;
           if (const int error = writeAll(stage.get(), bytes); error != 0) return error;
           mode_t mode = 0644;
           if (keep) {
             mode = there.st_mode & 0777;
             if (::fchown(stage.get(), there.st_uid, there.st_gid) != 0) mode &= 0700;
           }
           if (::fchmod(stage.get(), mode) != 0) return errno;
           if (const int error = syncFile(stage.get()); error != 0) return error;
           if (const int error = stage.publish(IfPresent::replaceNonDirectory); error != 0) return error;
           // The name is as durable as the bytes only once its directory is.
           return syncNames(place.directory.get());
         })
      .succeeded();
}

bool LinuxFileManager::writeFile(const std::string& path, std::string_view bytes) noexcept {
  return outcomeOf([&] {
           Place place;
           if (const int error = openPlace(path, &place); error != 0) return error;
           const UniqueFd file(::openat(place.directory.get(), place.name.c_str(),
                                        O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC,
                                        0644));
           if (!file.isValid()) return errno;
           return writeAll(file.get(), bytes);
         })
      .succeeded();
}

}  // namespace brenvik
