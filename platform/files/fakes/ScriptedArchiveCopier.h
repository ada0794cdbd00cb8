// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>
#include <utility>

#include "platform/files/ArchiveCopier.h"

namespace brenvik {

// Does what a test wrote down: signals the errors set here, then returns `result`. Outlives the copiers that
// its factory makes.
struct ArchiveScript {
  std::optional<ArchiveFileError> fileError;
  std::optional<int> fatalError;
  int result = 0;

  // What the copier saw.
  int made = 0;
  int living = 0;
  std::string archive;
  std::string destination;
  PropertyList options;
  std::optional<int> answer;

  inline ArchiveCopierFactory factory();
};

class ScriptedArchiveCopier final : public ArchiveCopier {
 public:
  explicit ScriptedArchiveCopier(ArchiveScript& script) : script_(script) {
    ++script_.made;
    ++script_.living;
  }
  ScriptedArchiveCopier(const ScriptedArchiveCopier&) = delete;
  ScriptedArchiveCopier& operator=(const ScriptedArchiveCopier&) = delete;
  ~ScriptedArchiveCopier() override { --script_.living; }

  void setFileErrorHandler(std::function<int(const ArchiveFileError&)> handler) override {
    onFileError_ = std::move(handler);
  }
  void setFatalErrorHandler(std::function<void(int)> handler) override { onFatalError_ = std::move(handler); }
  int copy(const std::string& archive, const std::string& destination,
           const PropertyList& options) noexcept override {
    script_.archive = archive;
    script_.destination = destination;
    script_.options = options;
    if (script_.fileError) {
      script_.answer = onFileError_ ? onFileError_(*script_.fileError) : archive_answer::stopCopy;
    }
    if (script_.fatalError && onFatalError_) onFatalError_(*script_.fatalError);
    return script_.result;
  }

 private:
  ArchiveScript& script_;
  std::function<int(const ArchiveFileError&)> onFileError_;
  std::function<void(int)> onFatalError_;
};

ArchiveCopierFactory ArchiveScript::factory() {
  return [this] { return std::make_unique<ScriptedArchiveCopier>(*this); };
}

}  // namespace brenvik
