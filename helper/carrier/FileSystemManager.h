// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "helper/carrier/FileSystemInterface.h"
#include "platform/files/FileManager.h"

namespace brenvik {

// The file operations over the platform's file manager and POSIX calls. Lives for one request on one thread;
// its only state is the release scope it holds open in the file manager.
class FileSystemManager final : public FileSystemInterface {
 public:
  explicit FileSystemManager(FileManager& files) : scope_(files) {}
  FileSystemManager(const FileSystemManager&) = delete;
  FileSystemManager& operator=(const FileSystemManager&) = delete;

  // Returns a factory that uses this file manager, which must outlive it.
  static FileSystemFactory factory(FileManager& files);

  int moveItem(const std::string& source, const std::string& destination) noexcept override;
  int moveItemWithOwner(const std::string& source, const std::string& destination, uid_t uid,
                        gid_t gid) noexcept override;
  int moveDirectory(const std::string& source, const std::string& destination) noexcept override;
  int copyItem(const std::string& source, const std::string& destination) noexcept override;
  int copyFileIntoDirectory(const std::string& sourceDirectory, const std::string& destinationDirectory,
                            const std::string& name) noexcept override;
  int setPermissions(const std::string& path, mode_t mode, bool recursive) noexcept override;
  int setOwner(const std::string& path, uid_t uid, gid_t gid, bool recursive) noexcept override;
  int createDirectory(const std::string& path, mode_t mode, bool intermediate) noexcept override;
  int createDirectoryWithOwner(const std::string& path, mode_t mode, const std::string& ownerName,
                               const std::string& groupName, bool intermediate) noexcept override;
  bool itemExists(const std::string& path) noexcept override;
  int listDirectory(const std::string& path, std::vector<std::string>* entries,
                    bool fullPaths) noexcept override;
  int findEntry(const std::string& directory, const std::string& namePrefix,
                std::string* path) noexcept override;
  int removeItem(const std::string& path) noexcept override;
  std::string baseName(const std::string& path) noexcept override;
  std::string directoryName(const std::string& path) noexcept override;
  std::string resolvePath(const std::string& path) noexcept override;
  std::string readLink(const std::string& path) noexcept override;
  PropertyList readDictionary(const std::string& path) noexcept override;
  std::optional<std::string> readData(const std::string& path) noexcept override;
  bool writeDictionary(const std::string& path, const PropertyList& dictionary) noexcept override;
  bool writePropertyList(const std::string& path, const PropertyList& propertyList,
                         PropertyListFormat format) noexcept override;
  bool writeData(const std::string& path, const std::string* data) noexcept override;
  bool isSymbolicLink(const std::string& path) noexcept override;
  int createSymbolicLink(const std::string& linkPath, const std::string& target) noexcept override;
  bool isDirectory(const std::string& path) noexcept override;
  bool createEmptyFile(const std::string& path) noexcept override;
  int placeLink(const std::string& linkPath, const std::string& target) noexcept override;
  int removeEntry(const std::string& path) noexcept override;
  int copyFileAndGive(const std::string& sourceDirectory, const std::string& destinationDirectory,
                      const std::string& name, uid_t uid, gid_t gid, bool* given) noexcept override;

 private:
  enum class Mode { copy, move };

  class ReleaseScope {
   public:
    explicit ReleaseScope(FileManager& files) : files_(files) { files_.openScope(); }
    ReleaseScope(const ReleaseScope&) = delete;
    ReleaseScope& operator=(const ReleaseScope&) = delete;
    ~ReleaseScope() { files_.closeScope(); }
    FileManager& files() const { return files_; }

   private:
    FileManager& files_;
  };

  class Merge;

  FileManager& files() const { return scope_.files(); }
  FileOutcome transfer(Mode mode, const std::string& source, const std::string& destination,
                       IfPresent ifPresent, Durability durability, Gift* gift);
  int copyOrMove(Mode mode, const std::string& source, const std::string& destination, uid_t uid, gid_t gid,
                 Durability durability = Durability::eventual, Gift* gift = nullptr);
  int merge(Mode mode, const std::string& source, const std::string& destination, IfPresent ifPresent,
            Durability durability, Gift* gift);
  int copyFile(const std::string& sourceDirectory, const std::string& destinationDirectory,
               const std::string& name, Gift* gift) noexcept;
  int setAttributesBelow(const std::string& path, const ItemAttributes& attributes);

  const ReleaseScope scope_;
};

}  // namespace brenvik
