// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <functional>
#include <string>

#include "platform/files/ArchiveCopier.h"

namespace brenvik {

class UnpackWriter;

// Unpacks zip archives. A short-lived process without rights, brenvik-archive-reader, reads the archive; this
// process writes the entries, into a hidden directory first. The copy fails if the reader dies, sends
// malformed data or takes too long.
class ZipArchiveCopier final : public ArchiveCopier {
 public:
  // At most 1 GiB is unpacked, which takes a tenth of this time on a slow disk.
  static constexpr std::chrono::seconds kLongestCopy{60};

  // `reader`: path of the reader's program.
  explicit ZipArchiveCopier(std::string reader, std::chrono::milliseconds longest = kLongestCopy)
      : reader_(std::move(reader)), longest_(longest) {}

  // Makes copiers with the reader beside this process's own program, else with the installed one. The factory
  // returns null if there is no reader.
  static ArchiveCopierFactory factory();

  void setFileErrorHandler(std::function<int(const ArchiveFileError&)> handler) override {
    onFileError_ = std::move(handler);
  }
  void setFatalErrorHandler(std::function<void(int)> handler) override { onFatalError_ = std::move(handler); }
  int copy(const std::string& archive, const std::string& destination,
           const PropertyList& options) noexcept override;

 private:
  int unpack(const std::string& archive, const std::string& destination, const PropertyList& options,
             bool* wasAnswered);
  int readInto(UnpackWriter& writer, int archive, std::chrono::steady_clock::time_point deadline);

  const std::string reader_;
  const std::chrono::milliseconds longest_;
  std::function<int(const ArchiveFileError&)> onFileError_;
  std::function<void(int)> onFatalError_;
};

}  // namespace brenvik
