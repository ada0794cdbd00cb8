// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/carrier/FileSystemManager.h"

#include <libgen.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>
#include <span>

#include "platform/base/Guarded.h"

namespace brenvik {
namespace {

constexpr mode_t kDirectoryMode = 0755;
constexpr std::size_t kPathBuffer = 1024;

// The path as it fits a fixed buffer: cut, and terminated.
std::array<char, kPathBuffer> cutCopy(const std::string& path) {
  std::array<char, kPathBuffer> copy{};
  path.copy(copy.data(), copy.size() - 1);
  return copy;
}

std::string baseNameOf(const std::string& path) {
  std::array<char, kPathBuffer> copy = cutCopy(path);
  return ::basename(copy.data());
}

std::string directoryNameOf(const std::string& path) {
  std::array<char, kPathBuffer> copy = cutCopy(path);
  return ::dirname(copy.data());
}

bool isForWantOfRoom(const FileOutcome& outcome) {
  const int code = outcome.codeOr(0);
  return code == ENOSPC || code == EDQUOT;
}

bool lacksMemory(const FileOutcome& outcome) { return outcome.codeOr(0) == ENOMEM; }

}  // namespace

FileSystemFactory FileSystemManager::factory(FileManager& files) {
  return [&files]() -> std::unique_ptr<FileSystemInterface> {
    return std::unique_ptr<FileSystemInterface>(new (std::nothrow) FileSystemManager(files));
  };
}

FileOutcome FileSystemManager::transfer(Mode mode, const std::string& source, const std::string& destination,
                                        IfPresent ifPresent, Durability durability, Gift* gift) {
  return mode == Mode::move ? files().moveItem(source, destination, ifPresent, durability)
                            : files().copyItem(source, destination, ifPresent, durability, gift);
}

int FileSystemManager::copyOrMove(Mode mode, const std::string& source, const std::string& destination,
                                  uid_t uid, gid_t gid, Durability durability, Gift* gift) {
  bool sourceIsDirectory = false;
  if (!files().itemExists(source, &sourceIsDirectory)) return kPosixFailure;
  bool destinationIsDirectory = false;
  if (!files().itemExists(destination, &destinationIsDirectory)) {
    (void)files().setAttributes(source, {{}, uid, gid});  // an item that keeps its owner is still transferred
    return transfer(mode, source, destination, IfPresent::fail, durability, gift).codeOr(kUnexplained);
  }
  if (!destinationIsDirectory && sourceIsDirectory) return EEXIST;

  std::string effective = destination;
  bool gives = true;  // what stands at the effective destination
  if (destinationIsDirectory) {
    effective += '/';
    effective += baseNameOf(source);
    bool isDirectoryThere = false;
    gives = files().itemExists(effective, &isDirectoryThere) && !isDirectoryThere;
  }
  (void)files().setAttributes(source, {{}, uid, gid});
  return merge(mode, source, effective, gives ? IfPresent::replaceNonDirectory : IfPresent::fail, durability,
               gift);
}

// Takes the items below the source of a merge to the destination, one by one.
class FileSystemManager::Merge final : public ItemVisitor {
 public:
  Merge(FileSystemManager& owner, Mode mode, const std::string& source, const std::string& destination)
      : owner_(owner), mode_(mode), source_(source), destination_(destination) {}

  Next visit(const std::string& subpath, bool isDirectory) noexcept override {
    try {
      return transferItem(subpath, isDirectory);
    } catch (const std::bad_alloc&) {
      lackedMemory_ = true;
      return Next::skipBelow;
    }
  }
  bool lackedMemory() const { return lackedMemory_; }

 private:
  Next transferItem(const std::string& subpath, bool isDirectory) {
    const std::string from = source_ + "/" + subpath;
    // A source that holds the destination would be copied into itself, and what was copied again, without
    // end.
    if (isDirectory && isDestination(from)) return Next::skipBelow;
    const std::string to = destination_ + "/" + subpath;
    bool fromIsDirectory = false;
    bool toIsDirectory = false;
    const bool bothExist =
        owner_.files().itemExists(to, &toIsDirectory) && owner_.files().itemExists(from, &fromIsDirectory);
    std::string parent = directoryNameOf(to);
    if (parent != lastParent_) {
      (void)owner_.createDirectory(parent, kDirectoryMode, true);  // without it the transfer fails by itself
      lastParent_ = std::move(parent);
    }
    // Replaced in one step: a full disk or a kill leaves the old file or the new one.
    const FileOutcome outcome = owner_.transfer(
        mode_, from, to,
        bothExist && !fromIsDirectory && !toIsDirectory ? IfPresent::replaceNonDirectory : IfPresent::fail,
        Durability::eventual, nullptr);  // thousands of files: the disk is waited for once, at the end
    if (outcome.succeeded()) return Next::skipBelow;  // a directory came over with all that is in it
    if (lacksMemory(outcome)) lackedMemory_ = true;
    // Below a link the items would be written to wherever it points.
    return isDirectory && owner_.isSymbolicLink(to) ? Next::skipBelow : Next::descend;
  }

  bool isDestination(const std::string& directory) const {
    struct stat here {};
    struct stat there {};
    return ::lstat(directory.c_str(), &here) == 0 && ::stat(destination_.c_str(), &there) == 0 &&
           here.st_dev == there.st_dev && here.st_ino == there.st_ino;
  }

  FileSystemManager& owner_;
  const Mode mode_;
  const std::string& source_;
  const std::string& destination_;
  std::string lastParent_;
  bool lackedMemory_ = false;
};

// 0 whatever fails, but for a lack of memory: then nobody knows what could have been transferred.
int FileSystemManager::merge(Mode mode, const std::string& source, const std::string& destination,
                             IfPresent ifPresent, Durability durability, Gift* gift) {
  const FileOutcome whole = transfer(mode, source, destination, ifPresent, durability, gift);
  if (whole.succeeded()) return 0;
  if (lacksMemory(whole)) return ENOMEM;
  bool lackedMemory = false;
  bool sourceIsDirectory = false;
  if (!files().itemExists(source, &sourceIsDirectory) || sourceIsDirectory) {
    // A file in a directory's way is still there; it stays when there is no room for the directory.
    if (ifPresent == IfPresent::replaceNonDirectory && !isForWantOfRoom(whole)) {
      (void)files().removeItem(destination);  // if it stays, the items below fail one by one
    }
    Merge items(*this, mode, source, destination);
    const FileOutcome below = files().enumerateBelow(source, items);
    lackedMemory = items.lackedMemory() || lacksMemory(below);
    if (durability == Durability::onReturn)
      (void)files().syncItem(destination);  // a merge reports no failure
  }
  // A copied directory goes as well if it is empty. The slash: nothing but a directory.
  (void)files().removeEntry(source + "/");
  return lackedMemory ? ENOMEM : 0;
}

int FileSystemManager::moveItem(const std::string& source, const std::string& destination) noexcept {
  return moveItemWithOwner(source, destination, ::getuid(), ::getgid());
}

int FileSystemManager::moveItemWithOwner(const std::string& source, const std::string& destination, uid_t uid,
                                         gid_t gid) noexcept {
  return guarded(ENOMEM, [&] { return copyOrMove(Mode::move, source, destination, uid, gid); });
}

int FileSystemManager::moveDirectory(const std::string& source, const std::string& destination) noexcept {
  if (!files().itemExists(source, nullptr)) return kPosixFailure;
  // What keeps its owner is moved all the same. Without memory, nothing is.
  if (setOwner(source, ::getuid(), ::getgid(), true) == ENOMEM) return ENOMEM;
  return files().moveItem(source, destination, IfPresent::fail, Durability::onReturn).codeOr(kUnexplained);
}

int FileSystemManager::copyItem(const std::string& source, const std::string& destination) noexcept {
  return guarded(ENOMEM, [&] { return copyOrMove(Mode::copy, source, destination, ::getuid(), ::getgid()); });
}

int FileSystemManager::copyFileIntoDirectory(const std::string& sourceDirectory,
                                             const std::string& destinationDirectory,
                                             const std::string& name) noexcept {
  return copyFile(sourceDirectory, destinationDirectory, name, nullptr);
}

int FileSystemManager::copyFileAndGive(const std::string& sourceDirectory,
                                       const std::string& destinationDirectory, const std::string& name,
                                       uid_t uid, gid_t gid, bool* given) noexcept {
  *given = false;
  return guarded(ENOMEM, [&] {
    const ItemAttributes owner{{}, uid, gid};
    const std::string destination = destinationDirectory + "/" + name;
    // Onto a directory the file is copied into it, and the directory is what is given.
    const bool isInto = isDirectory(destination);
    Gift gift;
    if (!isInto) gift.attributes = owner;
    const int code = copyFile(sourceDirectory, destinationDirectory, name, &gift);
    if (code != 0) return code;
    // A copy onto something reports no failure; of a directory it is a merge, which always succeeds.
    *given = gift.outcome.succeeded() || (isInto && isDirectory(sourceDirectory + "/" + name));
    // Never a file: somebody can have put another one in the directory's place.
    if (isInto && *given) {
      *given = files().setAttributes(destination, owner, ItemKinds::noFiles).succeeded() &&
               files().syncItem(destination).succeeded();
    }
    return 0;
  });
}

int FileSystemManager::copyFile(const std::string& sourceDirectory, const std::string& destinationDirectory,
                                const std::string& name, Gift* gift) noexcept {
  if (!itemExists(destinationDirectory) && createDirectory(destinationDirectory, kDirectoryMode, true) != 0) {
    return kPosixFailure;
  }
  return guarded(ENOMEM, [&] {
    return copyOrMove(Mode::copy, sourceDirectory + "/" + name, destinationDirectory + "/" + name, ::getuid(),
                      ::getgid(), Durability::onReturn, gift);
  });
}

int FileSystemManager::setAttributesBelow(const std::string& path, const ItemAttributes& attributes) {
  if (!files().itemExists(path, nullptr)) return kUnexplained;
  return files().setAttributesOfTree(path, attributes).codeOr(0);
}

int FileSystemManager::setPermissions(const std::string& path, mode_t mode, bool recursive) noexcept {
  if (!recursive) return ::chmod(path.c_str(), mode);
  return guarded(ENOMEM, [&] { return setAttributesBelow(path, {mode, {}, {}}); });
}

int FileSystemManager::setOwner(const std::string& path, uid_t uid, gid_t gid, bool recursive) noexcept {
  if (!recursive) return ::chown(path.c_str(), uid, gid);
  return guarded(ENOMEM, [&] { return setAttributesBelow(path, {{}, uid, gid}); });
}

int FileSystemManager::createDirectory(const std::string& path, mode_t mode, bool intermediate) noexcept {
  return createDirectoryWithOwner(path, mode, {}, {}, intermediate);
}

int FileSystemManager::createDirectoryWithOwner(const std::string& path, mode_t mode,
                                                const std::string& ownerName, const std::string& groupName,
                                                bool intermediate) noexcept {
  return files()
      .createDirectory(path, {mode, ownerName, groupName},
                       intermediate ? Intermediates::create : Intermediates::mustExist)
      .codeOr(0);
}

bool FileSystemManager::itemExists(const std::string& path) noexcept {
  return files().itemExists(path, nullptr);
}

int FileSystemManager::listDirectory(const std::string& path, std::vector<std::string>* entries,
                                     bool fullPaths) noexcept {
  return guarded(ENOMEM, [&] {
    entries->clear();
    const FileOutcome outcome = files().listDirectory(path, entries);
    if (fullPaths) {
      const std::string base = path.ends_with('/') ? path : path + "/";
      for (std::string& entry : *entries) entry.insert(0, base);
    }
    return outcome.codeOr(kUnexplained);
  });
}

int FileSystemManager::findEntry(const std::string& directory, const std::string& namePrefix,
                                 std::string* path) noexcept {
  return guarded(ENOMEM, [&] {
    path->clear();
    std::vector<std::string> entries;
    if (const int code = listDirectory(directory, &entries, false); code != 0) return code;
    const std::string* found = nullptr;
    for (const std::string& entry : entries) {
      if (entry.starts_with(namePrefix) && (found == nullptr || entry < *found)) found = &entry;
    }
    if (found == nullptr) return ENOENT;
    *path = (directory.ends_with('/') ? directory : directory + "/") + *found;
    return 0;
  });
}

int FileSystemManager::removeItem(const std::string& path) noexcept {
  return files().removeItem(path).codeOr(kUnexplained);
}

std::string FileSystemManager::baseName(const std::string& path) noexcept {
  return guarded(std::string(), [&] { return baseNameOf(path); });
}

std::string FileSystemManager::directoryName(const std::string& path) noexcept {
  return guarded(std::string(), [&] { return directoryNameOf(path); });
}

std::string FileSystemManager::resolvePath(const std::string& path) noexcept {
  const std::unique_ptr<char, decltype(&std::free)> resolved(::realpath(path.c_str(), nullptr), &std::free);
  if (!resolved) return {};
  return guarded(std::string(), [&] { return std::string(resolved.get()); });
}

std::string FileSystemManager::readLink(const std::string& path) noexcept {
  std::array<char, kPathBuffer> target{};
  const ssize_t length = ::readlink(path.c_str(), target.data(), target.size() - 1);
  if (length < 0) return {};
  return guarded(std::string(), [&] { return std::string(target.data(), static_cast<std::size_t>(length)); });
}

PropertyList FileSystemManager::readDictionary(const std::string& path) noexcept {
  const std::optional<std::string> bytes = readData(path);
  if (!bytes) return {};
  return guarded(PropertyList(), [&] {
    PropertyList value = parsePropertyList(std::as_bytes(std::span(*bytes)));
    return value.is(PropertyList::Type::dictionary) ? value : PropertyList();
  });
}

std::optional<std::string> FileSystemManager::readData(const std::string& path) noexcept {
  // No property list that is accepted is larger, and nothing else is read here.
  return files().readFile(path, kLargestXmlForm);
}

bool FileSystemManager::writeDictionary(const std::string& path, const PropertyList& dictionary) noexcept {
  if (!dictionary.is(PropertyList::Type::dictionary)) return false;
  return guarded(false, [&] {
    const std::optional<std::string> bytes = serializePropertyList(dictionary, PropertyListFormat::xml);
    return bytes && files().writeFileAtomically(path, *bytes);
  });
}

bool FileSystemManager::writePropertyList(const std::string& path, const PropertyList& propertyList,
                                          PropertyListFormat format) noexcept {
  return guarded(false, [&] {
    const std::optional<std::string> bytes = serializePropertyList(propertyList, format);
    return bytes && files().writeFile(path, *bytes);
  });
}

bool FileSystemManager::writeData(const std::string& path, const std::string* data) noexcept {
  return data != nullptr && files().writeFileAtomically(path, *data);
}

bool FileSystemManager::isSymbolicLink(const std::string& path) noexcept {
  struct stat info {};
  return ::lstat(path.c_str(), &info) == 0 && (info.st_mode & 0xF000) == 0xA000;
}

int FileSystemManager::createSymbolicLink(const std::string& linkPath, const std::string& target) noexcept {
  return ::symlink(target.c_str(), linkPath.c_str()) == 0 ? 0 : errno;
}

bool FileSystemManager::isDirectory(const std::string& path) noexcept {
  bool isDirectoryThere = false;
  return files().itemExists(path, &isDirectoryThere) && isDirectoryThere;
}

bool FileSystemManager::createEmptyFile(const std::string& path) noexcept {
  std::FILE* const file = std::fopen(path.c_str(), "we");
  if (file == nullptr) return false;
  (void)std::fclose(file);  // nothing was written
  return true;
}

int FileSystemManager::placeLink(const std::string& linkPath, const std::string& target) noexcept {
  return files().placeLink(linkPath, target).codeOr(kUnexplained);
}

int FileSystemManager::removeEntry(const std::string& path) noexcept {
  return files().removeEntry(path).codeOr(kUnexplained);
}

}  // namespace brenvik
