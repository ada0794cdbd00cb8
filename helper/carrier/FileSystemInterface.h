// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/plist/PropertyList.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {

// The file operations that the carrier routines are written against. The order of the operations is the order
// of the table's slots and is part of the interface: 0 and 1 are the destructor, 2 is moveItem, and so on.
//
// Paths are bytes without a NUL; relative ones start at the working directory. A mode is permission bits as
// for chmod(2), the umask ignored. An int result is 0 for success, else an errno value, kUnexplained where
// the platform failed without saying why, or kPosixFailure where a POSIX call failed: the operation says
// which. ENOMEM: memory did not suffice. Out parameters are the caller's and never null. Every operation
// waits for the file system; what it did is on the disk later, unless it says otherwise. One object serves
// one request on one thread. Nothing throws.
class FileSystemInterface {
 public:
  static constexpr int kUnexplained = 5;
  static constexpr int kPosixFailure = -1;

  virtual ~FileSystemInterface() = default;

  // Moves an item, links as links. Like moveItemWithOwner, for this process's own user and group.
  virtual int moveItem(const std::string& source, const std::string& destination) noexcept = 0;
  // Gives the source to the owner (a failure of that is ignored), then moves it.
  //   nothing at the destination: the source takes that name
  //   a directory: the source goes into it, under its own base name, and replaces a non-directory there; onto
  //   a
  //     directory of that name it is merged, and of the merge no failure is reported
  //   anything else: the source replaces it, or EEXIST if the source is a directory
  // kPosixFailure when there is no source. To another file system the item is copied and then removed; it is
  // whole at one of the two places in the end.
  virtual int moveItemWithOwner(const std::string& source, const std::string& destination, uid_t uid,
                                gid_t gid) noexcept = 0;
  // Gives the whole tree to this process's user and group (a failure of that is ignored), then moves it.
  // Unlike moveItem it never merges: EEXIST when the destination is there. kPosixFailure when there is no
  // source. On the disk when it succeeds.
  virtual int moveDirectory(const std::string& source, const std::string& destination) noexcept = 0;
  // Copies an item with its modes, times and extended attributes, by the rules of moveItemWithOwner and for
  // this process's own user and group. The source stays, but now belongs to that user.
  virtual int copyItem(const std::string& source, const std::string& destination) noexcept = 0;
  // Copies sourceDirectory/name to destinationDirectory/name, as copyItem does. Makes the destination
  // directory (mode 0755), and those above it, when there is none: kPosixFailure if that fails. On the disk
  // when it succeeds.
  virtual int copyFileIntoDirectory(const std::string& sourceDirectory,
                                    const std::string& destinationDirectory,
                                    const std::string& name) noexcept = 0;
  // Not recursive: chmod(2), links followed; kPosixFailure when it fails. Recursive: the item and everything
  // below it; kUnexplained when there is none, else the code of the item itself, else of the last failure
  // below it.
  virtual int setPermissions(const std::string& path, mode_t mode, bool recursive) noexcept = 0;
  // The same for the owner: chown(2).
  virtual int setOwner(const std::string& path, uid_t uid, gid_t gid, bool recursive) noexcept = 0;
  // Makes a directory of this mode. With `intermediate`, directories on the way are made too, and one that is
  // there is a success; without it that is EEXIST. A failure that the platform does not explain counts as
  // success.
  virtual int createDirectory(const std::string& path, mode_t mode, bool intermediate) noexcept = 0;
  // The same, owned by these accounts. Account names; an empty one leaves what the system gives.
  virtual int createDirectoryWithOwner(const std::string& path, mode_t mode, const std::string& ownerName,
                                       const std::string& groupName, bool intermediate) noexcept = 0;
  // Links followed: a dangling link does not exist. False, too, when that cannot be found out.
  virtual bool itemExists(const std::string& path) noexcept = 0;
  // Clears *entries, then appends the names in the directory, in no order; with `fullPaths`, the directory's
  // path before each. "." and ".." are left out.
  virtual int listDirectory(const std::string& path, std::vector<std::string>* entries,
                            bool fullPaths) noexcept = 0;
  // *path: the path of the bytewise first entry that begins with the prefix; ENOENT, and an empty path, when
  // there is none.
  virtual int findEntry(const std::string& directory, const std::string& namePrefix,
                        std::string* path) noexcept = 0;
  // Removes an item and all that is below it; a link as itself. ENOENT when there is none.
  virtual int removeItem(const std::string& path) noexcept = 0;
  // basename(3) and dirname(3) of the first 1,023 bytes. Empty when memory does not suffice.
  virtual std::string baseName(const std::string& path) noexcept = 0;
  virtual std::string directoryName(const std::string& path) noexcept = 0;
  // realpath(3): absolute, without links, "." and "..". Empty when it fails.
  virtual std::string resolvePath(const std::string& path) noexcept = 0;
  // The target of a link, at most 1,023 bytes; empty when it fails, as for anything that is no link.
  virtual std::string readLink(const std::string& path) noexcept = 0;
  // A property-list file, XML or binary, whose top level is a dictionary; else no value.
  virtual PropertyList readDictionary(const std::string& path) noexcept = 0;
  // A regular file's bytes; no value when it cannot be read whole.
  virtual std::optional<std::string> readData(const std::string& path) noexcept = 0;
  // Replaces the file whole or not at all, as XML; on the disk when it succeeds. A file that was there hands
  // on its owner and mode, a new one has mode 0644. False, and nothing is changed, when it fails or there is
  // no dictionary.
  virtual bool writeDictionary(const std::string& path, const PropertyList& dictionary) noexcept = 0;
  // Writes over the file, or makes it. False when it fails; the file may be cut short then.
  virtual bool writePropertyList(const std::string& path, const PropertyList& propertyList,
                                 PropertyListFormat format) noexcept = 0;
  // As writeDictionary, for bytes; false when `data` is null.
  virtual bool writeData(const std::string& path, const std::string* data) noexcept = 0;
  // lstat(2) says that it is a link. False, too, when there is nothing.
  virtual bool isSymbolicLink(const std::string& path) noexcept = 0;
  // Makes a link; EEXIST when anything is there. The target is any text and is not looked at.
  virtual int createSymbolicLink(const std::string& linkPath, const std::string& target) noexcept = 0;
  // Links followed. False, too, when there is nothing.
  virtual bool isDirectory(const std::string& path) noexcept = 0;
  // Makes an empty file, or truncates the one that is there.
  virtual bool createEmptyFile(const std::string& path) noexcept = 0;

  // ---- What the requests need beyond the slots above. Each is on the disk when it succeeds, unless it says
  // otherwise. ----

  // Places a link where nothing, a file, a link or an empty directory stands; what was there stays when it
  // fails.
  virtual int placeLink(const std::string& linkPath, const std::string& target) noexcept = 0;
  // Removes a file, a link or an empty directory.
  virtual int removeEntry(const std::string& path) noexcept = 0;
  // As copyFileIntoDirectory, and the copy belongs to this owner before it has its name. Onto a directory the
  // file is copied into it, and the directory gets the owner. *given: whether something was copied and has
  // the owner; the result alone does not tell, since a copy onto something reports no failure.
  virtual int copyFileAndGive(const std::string& sourceDirectory, const std::string& destinationDirectory,
                              const std::string& name, uid_t uid, gid_t gid, bool* given) noexcept = 0;
};

// Makes the object of one request; null when memory is exhausted. Called and used on the main thread.
using FileSystemFactory = std::function<std::unique_ptr<FileSystemInterface>()>;

}  // namespace brenvik
