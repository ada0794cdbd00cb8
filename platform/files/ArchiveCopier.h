// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/plist/PropertyList.h"

namespace brenvik {

// What the handler of a file error may answer.
namespace archive_answer {
inline constexpr int skipFile = 1;  // go on without this entry
inline constexpr int stopCopy = 2;  // give the whole copy up
}  // namespace archive_answer

// One entry of an archive that cannot be unpacked: where it would have gone and why not.
struct ArchiveFileError {
  std::string path;  // as the archive has it; may be any bytes
  int code;          // errno value
};

// Unpacks an archive into a directory. One object serves one copy, on one thread; handlers are called on that
// thread during copy(). Blocks on the disk, but has a time limit of its own.
class ArchiveCopier {
 public:
  virtual ~ArchiveCopier() = default;

  // An entry cannot be unpacked: it would leave the destination, is of a refused kind, or the like. The
  // answer is one of archive_answer; any other counts as stopCopy. Without a handler: stopCopy.
  virtual void setFileErrorHandler(std::function<int(const ArchiveFileError&)> handler) = 0;
  // The copy as a whole fails: no archive, a damaged one, no room, no time, the reader died.
  virtual void setFatalErrorHandler(std::function<void(int code)> handler) = 0;

  // Options, a dictionary of booleans: "extractPKZip" (the archive is a zip archive; required),
  // "copyExtendedAttributes", "copyResources" (resource data, which Linux keeps as "._name" beside its file).
  // 0 when everything was unpacked that no handler skipped, else an errno value. The destination and the
  // directories above it are made when missing. Nothing shows at the destination before the archive was read
  // to its end; a file that was there then gives way in one step. On the disk when it succeeds.
  virtual int copy(const std::string& archive, const std::string& destination,
                   const PropertyList& options) noexcept = 0;
};

// Makes a copier for one copy; null when none can be made.
using ArchiveCopierFactory = std::function<std::unique_ptr<ArchiveCopier>()>;

}  // namespace brenvik
