// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <functional>
#include <string>

#include "platform/files/ArchiveCopier.h"

namespace brenvik {

class UnpackWriter;

// Unpacks zip archives. The archive is read by a short-lived process without rights, brenvik-archive-reader;
// what it reports is written by this one, into a hidden directory first. A reader that dies, says nonsense or
// takes too long is a failed copy.
class ZipArchiveCopier final : public ArchiveCopier {
 public:
  // 1 GiB, the most that is unpacked, takes a tenth of it on a slow disk.
  static constexpr std::chrono::seconds kLongestCopy{60};

  // `reader`: path of the reader's program.
  explicit ZipArchiveCopier(std::string reader, std::chrono::milliseconds longest = kLongestCopy)
      : reader_(std::move(reader)), longest_(longest) {}

  // Copiers with the reader found beside this process's own program, else in the installed place; none where
  // there is no reader.
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
