// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <map>
#include <string>
#include <vector>

#include "platform/files/FileManager.h"

namespace brenvik {

// A real file manager that fails where a test asks for it, and remembers what it was asked to do.
class FaultyFileManager : public FileManager {
 public:
  explicit FaultyFileManager(FileManager& real) : real_(real) {}

  // From now on calls of the operation, named as in FileManager, end like this and do nothing.
  void fail(const std::string& operation, FileOutcome outcome) {
    faults_.insert_or_assign(operation, outcome);
  }
  // The same, only for calls whose last path contains `part`.
  void failAt(const std::string& operation, const std::string& part, FileOutcome outcome) {
    partOf_[operation] = part;
    fail(operation, outcome);
  }
  // From now on the operation is the real one again.
  void recover(const std::string& operation) {
    faults_.erase(operation);
    partOf_.erase(operation);
  }

  std::vector<std::string> calls;        // "operation path [path]"
  std::vector<Durability> durabilities;  // of copyItem and moveItem
  int openScopes = 0;
  int scopesOpened = 0;

  void openScope() noexcept override {
    ++openScopes;
    ++scopesOpened;
    real_.openScope();
  }
  void closeScope() noexcept override {
    --openScopes;
    real_.closeScope();
  }
  bool itemExists(const std::string& path, bool* isDirectory) noexcept override {
    return real_.itemExists(path, isDirectory);
  }
  FileOutcome copyItem(const std::string& source, const std::string& destination, IfPresent ifPresent,
                       Durability durability, Gift* gift) noexcept override {
    durabilities.push_back(durability);
    calls.push_back("copyItem " + source + " " + destination);
    if (const FileOutcome* fault = faultOf("copyItem", destination)) return *fault;
    return real_.copyItem(source, destination, ifPresent, durability, gift);
  }
  FileOutcome moveItem(const std::string& source, const std::string& destination, IfPresent ifPresent,
                       Durability durability) noexcept override {
    durabilities.push_back(durability);
    calls.push_back("moveItem " + source + " " + destination);
    if (const FileOutcome* fault = faultOf("moveItem", destination)) return *fault;
    return real_.moveItem(source, destination, ifPresent, durability);
  }
  FileOutcome removeEntry(const std::string& path) noexcept override {
    if (const FileOutcome* fault = faultOf("removeEntry", path)) return *fault;
    return real_.removeEntry(path);
  }
  FileOutcome placeLink(const std::string& path, const std::string& target) noexcept override {
    if (const FileOutcome* fault = faultOf("placeLink", path)) return *fault;
    return real_.placeLink(path, target);
  }
  FileOutcome syncItem(const std::string& path) noexcept override {
    if (const FileOutcome* fault = faultOf("syncItem", path)) return *fault;
    return real_.syncItem(path);
  }
  FileOutcome removeItem(const std::string& path) noexcept override {
    calls.push_back("removeItem " + path);
    if (const FileOutcome* fault = faultOf("removeItem", path)) return *fault;
    return real_.removeItem(path);
  }
  FileOutcome createDirectory(const std::string& path, const DirectoryAttributes& attributes,
                              Intermediates intermediates) noexcept override {
    calls.push_back("createDirectory " + path);
    createdWith = {std::string(attributes.ownerName), std::string(attributes.groupName)};
    if (const FileOutcome* fault = faultOf("createDirectory", path)) return *fault;
    return real_.createDirectory(path, attributes, intermediates);
  }
  FileOutcome listDirectory(const std::string& path, std::vector<std::string>* names) noexcept override {
    if (const FileOutcome* fault = faultOf("listDirectory", path)) return *fault;
    return real_.listDirectory(path, names);
  }
  FileOutcome enumerateBelow(const std::string& path, ItemVisitor& visitor) noexcept override {
    if (const FileOutcome* fault = faultOf("enumerateBelow", path)) return *fault;
    return real_.enumerateBelow(path, visitor);
  }
  FileOutcome setAttributes(const std::string& path, const ItemAttributes& attributes,
                            ItemKinds kinds) noexcept override {
    calls.push_back("setAttributes " + path);
    if (const FileOutcome* fault = faultOf("setAttributes", path)) return *fault;
    return real_.setAttributes(path, attributes, kinds);
  }
  FileOutcome setAttributesOfTree(const std::string& path,
                                  const ItemAttributes& attributes) noexcept override {
    calls.push_back("setAttributesOfTree " + path);
    if (const FileOutcome* fault = faultOf("setAttributesOfTree", path)) return *fault;
    return real_.setAttributesOfTree(path, attributes);
  }
  std::optional<std::string> readFile(const std::string& path, std::size_t limit) noexcept override {
    return real_.readFile(path, limit);
  }
  bool writeFileAtomically(const std::string& path, std::string_view bytes) noexcept override {
    if (faultOf("writeFileAtomically", path) != nullptr) return false;
    return real_.writeFileAtomically(path, bytes);
  }
  bool writeFile(const std::string& path, std::string_view bytes) noexcept override {
    if (faultOf("writeFile", path) != nullptr) return false;
    return real_.writeFile(path, bytes);
  }

  std::pair<std::string, std::string> createdWith;  // owner and group names of the last createDirectory

 private:
  const FileOutcome* faultOf(const std::string& operation, const std::string& path) const {
    const auto fault = faults_.find(operation);
    if (fault == faults_.end()) return nullptr;
    const auto part = partOf_.find(operation);
    if (part != partOf_.end() && path.find(part->second) == std::string::npos) return nullptr;
    return &fault->second;
  }

  FileManager& real_;
  std::map<std::string, FileOutcome> faults_;
  std::map<std::string, std::string> partOf_;
};

}  // namespace brenvik
