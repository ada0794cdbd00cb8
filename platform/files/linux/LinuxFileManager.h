// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/files/FileManager.h"
#include "platform/files/linux/FileContents.h"

namespace brenvik {

// The file manager on Linux: at and beneath directory descriptors, see FileManager for the contract.
class LinuxFileManager final : public FileManager {
 public:
  void openScope() noexcept override { ++scopes_; }
  void closeScope() noexcept override;

  bool itemExists(const std::string& path, bool* isDirectory) noexcept override;
  FileOutcome copyItem(const std::string& source, const std::string& destination,
                       IfPresent ifPresent) noexcept override;
  FileOutcome moveItem(const std::string& source, const std::string& destination,
                       IfPresent ifPresent) noexcept override;
  FileOutcome removeItem(const std::string& path) noexcept override;
  FileOutcome createDirectory(const std::string& path, const DirectoryAttributes& attributes,
                              Intermediates intermediates) noexcept override;
  FileOutcome listDirectory(const std::string& path, std::vector<std::string>* names) noexcept override;
  FileOutcome enumerateBelow(const std::string& path, ItemVisitor& visitor) noexcept override;
  FileOutcome setAttributes(const std::string& path, const ItemAttributes& attributes) noexcept override;
  std::optional<std::string> readFile(const std::string& path, std::size_t limit) noexcept override;
  bool writeFileAtomically(const std::string& path, std::string_view bytes) noexcept override;
  bool writeFile(const std::string& path, std::string_view bytes) noexcept override;

 private:
  int copy(const std::string& source, const std::string& destination, IfPresent ifPresent);
  int move(const std::string& source, const std::string& destination, IfPresent ifPresent);
  FileContents& contents();

  int scopes_ = 0;
  std::unique_ptr<FileContents> contents_;  // lives as long as a scope is open
};

}  // namespace brenvik
