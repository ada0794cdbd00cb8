// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/plist/PropertyList.h"

namespace brenvik {

// The answers of a file error handler.
namespace archive_answer {
inline constexpr int skipFile = 1;  // go on without this entry
inline constexpr int stopCopy = 2;  // give up the whole copy
}  // namespace archive_answer

// One entry of an archive that cannot be unpacked: where it would have gone and why not.
struct ArchiveFileError {
  std::string path;  // as the archive spells it; any bytes
  int code;          // errno value
};

// Unpacks an archive into a directory. One object serves one copy, on one thread; handlers are called on that
// thread during copy(). Blocks on the disk, but has a time limit of its own.
class ArchiveCopier {
 public:
  virtual ~ArchiveCopier() = default;

  // The handler runs when an entry cannot be unpacked, for example because it would leave the destination or
  // is of a refused kind. It returns one of archive_answer; any other value counts as stopCopy, and so does
  // the lack of a handler.
  virtual void setFileErrorHandler(std::function<int(const ArchiveFileError&)> handler) = 0;
  // The handler runs with an errno value when the whole copy fails: the archive is missing or damaged, the
  // disk is full, the time is over, or the reader died.
  virtual void setFatalErrorHandler(std::function<void(int code)> handler) = 0;

  // Options, a dictionary of booleans: "extractPKZip" (the archive is a zip archive; required),
  // "copyExtendedAttributes", "copyResources" (resource data, which Linux keeps as "._name" beside its file).
  // Returns 0 if every entry that no handler skipped was unpacked, else an errno value. Makes the destination
  // and the directories above it if they are missing. Nothing appears at the destination before the archive
  // has been read to its end; existing files are then replaced in one step each. On success everything is on
  // the disk.
  virtual int copy(const std::string& archive, const std::string& destination,
                   const PropertyList& options) noexcept = 0;
};

// Makes a copier for one copy; null when none can be made.
using ArchiveCopierFactory = std::function<std::unique_ptr<ArchiveCopier>()>;

}  // namespace brenvik
