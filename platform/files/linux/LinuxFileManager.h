// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/stat.h>

#include <memory>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/files/FileManager.h"
#include "platform/files/linux/FileContents.h"
#include "platform/files/linux/Placement.h"
#include "platform/files/linux/TreeCopier.h"

namespace brenvik {

// The file manager on Linux, which works at and beneath directory descriptors. FileManager has the contract.
class LinuxFileManager final : public FileManager {
 public:
  void openScope() noexcept override { ++scopes_; }
  void closeScope() noexcept override;

  bool itemExists(const std::string& path, bool* isDirectory) noexcept override;
  FileOutcome copyItem(const std::string& source, const std::string& destination, IfPresent ifPresent,
                       Durability durability = Durability::eventual, Gift* gift = nullptr) noexcept override;
  FileOutcome moveItem(const std::string& source, const std::string& destination, IfPresent ifPresent,
                       Durability durability = Durability::eventual) noexcept override;
  FileOutcome removeItem(const std::string& path) noexcept override;
  FileOutcome removeEntry(const std::string& path) noexcept override;
  FileOutcome placeLink(const std::string& path, const std::string& target) noexcept override;
  FileOutcome syncItem(const std::string& path) noexcept override;
  FileOutcome createDirectory(const std::string& path, const DirectoryAttributes& attributes,
                              Intermediates intermediates) noexcept override;
  FileOutcome listDirectory(const std::string& path, std::vector<std::string>* names) noexcept override;
  FileOutcome enumerateBelow(const std::string& path, ItemVisitor& visitor) noexcept override;
  FileOutcome setAttributes(const std::string& path, const ItemAttributes& attributes,
                            ItemKinds kinds = ItemKinds::all) noexcept override;
  FileOutcome setAttributesOfTree(const std::string& path,
                                  const ItemAttributes& attributes) noexcept override;
  std::optional<std::string> readFile(const std::string& path, std::size_t limit) noexcept override;
  bool writeFileAtomically(const std::string& path, std::string_view bytes) noexcept override;
  bool writeFile(const std::string& path, std::string_view bytes) noexcept override;

 private:
  struct ResolvedAttributes;

  int copy(const std::string& source, const std::string& destination, IfPresent ifPresent,
           Durability durability, Gift* gift);
  int move(const std::string& source, const std::string& destination, IfPresent ifPresent,
           Durability durability);
  int moveAcross(const Place& from, const Place& to, IfPresent ifPresent);
  void give(int item, Gift* gift);
  int stageSpecial(TreeCopier& copier, const Place& from, const struct stat& info, Stage& stage, Gift* gift);
  int stageContents(TreeCopier& copier, int item, const struct stat& info, const Place& to, Stage& stage);
  int stageCopy(const Place& from, struct stat* info, const Place& to, Stage& stage,
                TreeCopier::Source afterwards, Durability durability, Gift* gift = nullptr);
  enum class Reach { item, tree };
  int change(const std::string& path, const ItemAttributes& attributes, ItemKinds kinds, Reach reach);
  int makeDirectory(const std::string& path, const ResolvedAttributes& attributes);
  int makeDirectories(const std::string& path, const ResolvedAttributes& attributes);
  int openPlace(const std::string& path, Place* place);
  void removeLeftoversOnce(const Place& place);
  FileContents& contents();

  int scopes_ = 0;
  // Live as long as a scope is open.
  std::unique_ptr<FileContents> contents_;
  std::set<std::pair<dev_t, ino_t>> cleared_;  // folders whose leftovers have been looked for
};

}  // namespace brenvik
