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
// for chmod(2); the umask is ignored. An int result is 0 for success, else an errno value, kUnexplained if
// the platform failed without saying why, or kPosixFailure if a POSIX call failed; each operation says which.
// ENOMEM means that memory ran out. Out parameters belong to the caller and are never null. Every operation
// blocks on the file system; the system writes its changes to the disk later, unless the operation says
// otherwise. One object serves one request on one thread. Nothing throws.
class FileSystemInterface {
 public:
  static constexpr int kUnexplained = 5;
  static constexpr int kPosixFailure = -1;

  virtual ~FileSystemInterface() = default;

  // Moves an item; a link is moved as a link. Like moveItemWithOwner, for this process's own user and group.
  virtual int moveItem(const std::string& source, const std::string& destination) noexcept = 0;
  // Changes the source's owner (ignoring a failure of that), then moves it. If the destination is
  //   missing: the source gets that name
  //   a directory: the source goes into it under its own base name and replaces a non-directory there; if a
  //     directory has that name, the source is merged into it, and failures of the merge are not reported
  //   anything else: the source replaces it; EEXIST if the source is a directory
  // kPosixFailure if there is no source. On a move to another file system the item is copied and then
  // removed; in the end it is whole at one of the two places.
  virtual int moveItemWithOwner(const std::string& source, const std::string& destination, uid_t uid,
                                gid_t gid) noexcept = 0;
  // Gives the whole tree to this process's user and group (ignoring a failure of that, but for ENOMEM), then
  // moves it. Unlike moveItem it never merges: EEXIST if the destination exists. kPosixFailure if there is no
  // source. On success everything is on the disk.
  virtual int moveDirectory(const std::string& source, const std::string& destination) noexcept = 0;
  // Copies an item with its modes, times and extended attributes, by the rules of moveItemWithOwner and for
  // this process's own user and group. The source stays, but that user now owns it.
  virtual int copyItem(const std::string& source, const std::string& destination) noexcept = 0;
  // Copies sourceDirectory/name to destinationDirectory/name, as copyItem does. Makes the destination
  // directory (mode 0755), and those above it, if it is missing: kPosixFailure if that fails. On success
  // everything is on the disk.
  virtual int copyFileIntoDirectory(const std::string& sourceDirectory,
                                    const std::string& destinationDirectory,
                                    const std::string& name) noexcept = 0;
  // Not recursive: chmod(2), which follows links; kPosixFailure if it fails. Recursive: the item and
  // everything below it; kUnexplained if there is no item, else the code of the item itself, else of the last
  // failure below it.
  virtual int setPermissions(const std::string& path, mode_t mode, bool recursive) noexcept = 0;
  // The same for the owner: chown(2).
  virtual int setOwner(const std::string& path, uid_t uid, gid_t gid, bool recursive) noexcept = 0;
  // Makes a directory with this mode. With `intermediate`, it also makes missing directories above it, and an
  // existing directory is a success; without it, that is EEXIST. A failure that the platform does not explain
  // counts as success.
  virtual int createDirectory(const std::string& path, mode_t mode, bool intermediate) noexcept = 0;
  // The same, with an owner and a group, given by name; an empty name leaves the system's default.
  virtual int createDirectoryWithOwner(const std::string& path, mode_t mode, const std::string& ownerName,
                                       const std::string& groupName, bool intermediate) noexcept = 0;
  // Whether the item exists. Follows links: a dangling link does not exist. Also false if that cannot be
  // found out.
  virtual bool itemExists(const std::string& path) noexcept = 0;
  // Clears *entries, then appends the names in the directory, without "." and "..", in no particular order;
  // with `fullPaths`, each with the directory's path in front.
  virtual int listDirectory(const std::string& path, std::vector<std::string>* entries,
                            bool fullPaths) noexcept = 0;
  // Sets *path to the path of the first entry, in byte order, whose name begins with the prefix. ENOENT and
  // an empty path if there is none.
  virtual int findEntry(const std::string& directory, const std::string& namePrefix,
                        std::string* path) noexcept = 0;
  // Removes an item and everything below it; a link itself, not its target. ENOENT if there is none.
  virtual int removeItem(const std::string& path) noexcept = 0;
  // basename(3) and dirname(3) of the first 1,023 bytes. Empty if memory runs out.
  virtual std::string baseName(const std::string& path) noexcept = 0;
  virtual std::string directoryName(const std::string& path) noexcept = 0;
  // realpath(3): absolute, without links, "." and "..". Empty on failure.
  virtual std::string resolvePath(const std::string& path) noexcept = 0;
  // The target of a link, at most 1,023 bytes. Empty on failure, for example if the item is not a link.
  virtual std::string readLink(const std::string& path) noexcept = 0;
  // Reads a property-list file, XML or binary, whose top level is a dictionary; returns no value otherwise.
  virtual PropertyList readDictionary(const std::string& path) noexcept = 0;
  // Returns a regular file's bytes; no value if it cannot be read whole.
  virtual std::optional<std::string> readData(const std::string& path) noexcept = 0;
  // Replaces the file with the dictionary as XML, whole or not at all. On success it is on the disk. The new
  // file keeps the owner and mode of the old one, or gets mode 0644 if there was none. Returns false and
  // changes nothing if it fails or the value is not a dictionary.
  virtual bool writeDictionary(const std::string& path, const PropertyList& dictionary) noexcept = 0;
  // Overwrites the file, or makes it. Returns false on failure; the file may then be truncated.
  virtual bool writePropertyList(const std::string& path, const PropertyList& propertyList,
                                 PropertyListFormat format) noexcept = 0;
  // Like writeDictionary, for bytes. Returns false if `data` is null.
  virtual bool writeData(const std::string& path, const std::string* data) noexcept = 0;
  // Whether lstat(2) finds a link. Also false if there is no item.
  virtual bool isSymbolicLink(const std::string& path) noexcept = 0;
  // Makes a link; EEXIST if the path exists. The target may be any text; it is not checked.
  virtual int createSymbolicLink(const std::string& linkPath, const std::string& target) noexcept = 0;
  // Whether the path is a directory. Follows links. Also false if there is no item.
  virtual bool isDirectory(const std::string& path) noexcept = 0;
  // Makes an empty file, or truncates the existing one.
  virtual bool createEmptyFile(const std::string& path) noexcept = 0;

  // ---- Operations beyond the slots above. On success the change is on the disk, unless the operation says
  // otherwise. ----

  // Makes a link, and replaces a file, a link or an empty directory that is there. On failure the old item
  // stays.
  virtual int placeLink(const std::string& linkPath, const std::string& target) noexcept = 0;
  // Removes a file, a link or an empty directory.
  virtual int removeEntry(const std::string& path) noexcept = 0;
  // Like copyFileIntoDirectory, but the copy gets this owner before it has its name. If the destination is a
  // directory, the file is copied into it and the directory gets the owner. *given tells whether the file was
  // copied and has the owner; the result alone does not, since a copy onto an existing item reports no
  // failure.
  virtual int copyFileAndGive(const std::string& sourceDirectory, const std::string& destinationDirectory,
                              const std::string& name, uid_t uid, gid_t gid, bool* given) noexcept = 0;
};

// Makes the object for one request; returns null if memory runs out. Called and used on the main thread.
using FileSystemFactory = std::function<std::unique_ptr<FileSystemInterface>()>;

}  // namespace brenvik
