// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <span>
#include <string>

#include "platform/gzip/Gunzip.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/web/WebClient.h"

namespace brenvik {

// A file system, in bytes.
struct DiskSpace {
  std::uint64_t size = 0;
  std::uint64_t available = 0;
};
// The one that an open file stands on; nothing is available where that cannot be told.
DiskSpace diskSpaceOf(int file) noexcept;

// What unpacking leaves free of a file system of this size: other programs keep their state there. 16 MiB,
// and of a small one 2 %, or nothing would ever be installed there.
constexpr std::uint64_t diskReserve(std::uint64_t size) noexcept {
  return std::min(std::uint64_t{16} << 20, size / 50);
}

enum class WifiOnly : bool { no, yes };

// Downloads one URL into memory and can then write what came, gunzipped, to a file. Made for one fetch, on
// the caller's stack. One thread at a time.
class HttpFetcher {
 public:
  // What it works with; all of it outlives the fetcher.
  struct Parts {
    WorkQueues& queues;
    WebClient& web;
    Gunzip& gunzip;
    std::function<DiskSpace(int file)> diskSpace = diskSpaceOf;
  };

  explicit HttpFetcher(const Parts& parts);
  HttpFetcher(const HttpFetcher&) = delete;
  HttpFetcher& operator=(const HttpFetcher&) = delete;

  // Blocks until the HTTP client reports, without a limit of its own. True when a body came that is not
  // empty; one of more than `largestBody` bytes is a failure. Fails at once on this object's own queue, which
  // it would block.
  bool fetch(const std::string& url, WifiOnly wifiOnly, std::uint64_t largestBody = kLargestWebBody) noexcept;

  // Writes the body, which must have been delivered as a gzip file, uncompressed to the path. The file is on
  // the disk when this returns true; when it returns false, there is none.
  bool uncompressTo(const std::string& path);

  // The body, as long as this object lives and fetches nothing else.
  std::span<const std::byte> bodyAsData() const noexcept { return body_; }

 private:
  void completed(const std::string& url, const std::shared_ptr<WebResponse>& response);
  bool uncompressInto(int file, const std::string& path);

  const Parts parts_;
  const std::shared_ptr<WorkQueue> queue_;
  WebBody body_;       // of the last successful response
  HeaderMap headers_;  // likewise
};

}  // namespace brenvik
