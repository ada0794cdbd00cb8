// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>

#include "platform/base/UniqueFd.h"
#include "platform/files/ArchiveCopier.h"
#include "platform/files/archive/ArchiveFrames.h"

namespace brenvik {

struct UnpackOptions {
  bool extendedAttributes = false;
  bool resources = false;
};

// Writes an archive's entries beneath a directory that nobody else writes to, and nowhere else: it checks
// every path, and the kernel follows no link and stays within the subtree. Files and directories get the
// archive's permission bits, files its times too; directories without an entry get mode 0755. One thread; may
// throw std::bad_alloc.
class UnpackWriter final : public ArchiveFrameSink {
 public:
  static constexpr std::uint64_t kMaxEntries = 100'000;
  static constexpr std::uint64_t kMaxBytes = std::uint64_t{1} << 30;

  // `top` must outlive the object. `mostBytes` limits all files together. `onFileError` returns an
  // archive_answer (ArchiveCopier.h).
  UnpackWriter(int top, UnpackOptions options, std::uint64_t mostBytes,
               std::function<int(const ArchiveFileError&)> onFileError);

  int beginEntry(const ArchiveEntry& entry) override;
  int entryData(std::string_view bytes) override;
  int entryCompanion(std::string_view bytes) override;
  int endEntry() override;
  int refuseEntry(const std::string& path, int code) override;
  // A file that takes the current entry's next data without entryData(), and how much of it at most.
  struct Room {
    int file = -1;
    std::size_t bytes = 0;
  };
  Room roomForData() const;
  // Call it after this many bytes were written there.
  void dataWritten(std::size_t bytes);
  // Call it after the last entry. Returns 0 or an errno.
  int finish();

  // Whether an answer of onFileError ended the copy; then no fatal error is reported.
  bool wasStoppedByAnswer() const { return stoppedByAnswer_; }

 private:
  int fileError(const std::string& path, int code);
  int start(const ArchiveEntry& entry);
  int openParent(const std::string& directory);
  int makeFile(const char* name, mode_t mode, UniqueFd* file);
  int setDirectoryMode(const std::string& path, mode_t mode);
  int finishEntry();
  int count(std::uint64_t bytes);

  const int top_;
  const UnpackOptions options_;
  const std::uint64_t mostBytes_;
  const std::function<int(const ArchiveFileError&)> onFileError_;
  const mode_t umask_;

  std::uint64_t entries_ = 0;
  std::uint64_t bytes_ = 0;
  bool stoppedByAnswer_ = false;

  std::map<std::string, mode_t> closed_;  // final modes of directories that their owner could not write to

  std::string parentPath_;  // of parent_
  UniqueFd parent_;

  ArchiveEntry entry_;
  std::string name_;  // of the entry in its directory
  bool skipping_ = false;
  std::uint64_t written_ = 0;
  UniqueFd file_;
  UniqueFd companion_;
  std::string companionHead_;  // the part that is searched for attributes
};

}  // namespace brenvik
