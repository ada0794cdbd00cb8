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
// Paths are NUL-terminated bytes. An int result is 0 for success, else an errno value, 5 where the platform
// failed without saying why, or -1 where a POSIX call returned that. One object serves one request on one
// thread. Nothing throws.
class FileSystemInterface {
 public:
  virtual ~FileSystemInterface() = default;

  virtual int moveItem(const std::string& source, const std::string& destination) noexcept = 0;
  // The owner goes to the source before it is moved.
  virtual int moveItemWithOwner(const std::string& source, const std::string& destination, uid_t uid,
                                gid_t gid) noexcept = 0;
  // Unlike moveItem, gives the whole tree to this process's user first and never merges.
  virtual int moveDirectory(const std::string& source, const std::string& destination) noexcept = 0;
  virtual int copyItem(const std::string& source, const std::string& destination) noexcept = 0;
  // Makes the destination directory when there is none.
  virtual int copyFileIntoDirectory(const std::string& sourceDirectory,
                                    const std::string& destinationDirectory,
                                    const std::string& name) noexcept = 0;
  virtual int setPermissions(const std::string& path, mode_t mode, bool recursive) noexcept = 0;
  virtual int setOwner(const std::string& path, uid_t uid, gid_t gid, bool recursive) noexcept = 0;
  // With `intermediate`, directories on the way are made too, and one that is there is a success. A failure
  // that the platform does not explain counts as success.
  virtual int createDirectory(const std::string& path, mode_t mode, bool intermediate) noexcept = 0;
  // Account names; empty: as the system gives.
  virtual int createDirectoryWithOwner(const std::string& path, mode_t mode, const std::string& ownerName,
                                       const std::string& groupName, bool intermediate) noexcept = 0;
  // Links followed: a dangling link does not exist.
  virtual bool itemExists(const std::string& path) noexcept = 0;
  virtual int listDirectory(const std::string& path, std::vector<std::string>* entries,
                            bool fullPaths) noexcept = 0;
  // The bytewise first entry that begins with the prefix; ENOENT, and an empty path, when there is none.
  virtual int findEntry(const std::string& directory, const std::string& namePrefix,
                        std::string* path) noexcept = 0;
  virtual int removeItem(const std::string& path) noexcept = 0;
  // basename(3) and dirname(3) of the first 1,023 bytes.
  virtual std::string baseName(const std::string& path) noexcept = 0;
  virtual std::string directoryName(const std::string& path) noexcept = 0;
  // Empty when it fails.
  virtual std::string resolvePath(const std::string& path) noexcept = 0;
  // At most 1,023 bytes; empty when it fails.
  virtual std::string readLink(const std::string& path) noexcept = 0;
  // A property-list file, XML or binary, whose top level is a dictionary; else no value.
  virtual PropertyList readDictionary(const std::string& path) noexcept = 0;
  virtual std::optional<std::string> readData(const std::string& path) noexcept = 0;
  // Atomically and durably, as XML; false when there is no dictionary.
  virtual bool writeDictionary(const std::string& path, const PropertyList& dictionary) noexcept = 0;
  // In place, through a stream.
  virtual bool writePropertyList(const std::string& path, const PropertyList& propertyList,
                                 PropertyListFormat format) noexcept = 0;
  // As writeDictionary; null: no data.
  virtual bool writeData(const std::string& path, const std::string* data) noexcept = 0;
  virtual bool isSymbolicLink(const std::string& path) noexcept = 0;
  virtual int createSymbolicLink(const std::string& linkPath, const std::string& target) noexcept = 0;
  virtual bool isDirectory(const std::string& path) noexcept = 0;
  // Truncates what is there.
  virtual bool createEmptyFile(const std::string& path) noexcept = 0;

  // What the requests need beyond the slots above. Each is on the disk when it succeeds, unless it says
  // otherwise. A link where nothing, a file, a link or an empty directory stands; what was there stays when
  // it fails.
  virtual int placeLink(const std::string& linkPath, const std::string& target) noexcept = 0;
  // A file, a link or an empty directory.
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
