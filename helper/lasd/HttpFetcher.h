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
// The space of the file system that holds an open file; nothing is available if that cannot be found out.
DiskSpace diskSpaceOf(int file) noexcept;

// The bytes that unpacking leaves free on a file system of this size, because other programs keep their state
// there: 16 MiB, or 2 % of a small file system, where 16 MiB would leave no room for a database.
constexpr std::uint64_t diskReserve(std::uint64_t size) noexcept {
  return std::min(std::uint64_t{16} << 20, size / 50);
}

enum class WifiOnly : bool { no, yes };

// Downloads one URL into memory, and can then write the body, gunzipped, to a file. Make one on the stack for
// each fetch. One thread at a time.
class HttpFetcher {
 public:
  // The fetcher's dependencies, which must outlive it.
  struct Parts {
    WorkQueues& queues;
    WebClient& web;
    Gunzip& gunzip;
    std::function<DiskSpace(int file)> diskSpace = diskSpaceOf;
  };

  explicit HttpFetcher(const Parts& parts);
  HttpFetcher(const HttpFetcher&) = delete;
  HttpFetcher& operator=(const HttpFetcher&) = delete;

  // Blocks until the HTTP client reports, without a time limit of its own. Returns true if a body arrived
  // that is not empty; a body of more than `largestBody` bytes is a failure. Fails at once if called on this
  // object's own queue, which it would block.
  bool fetch(const std::string& url, WifiOnly wifiOnly, std::uint64_t largestBody = kLargestWebBody) noexcept;

  // Writes the body, which must be a gzip file, uncompressed to the path. If this returns true, the file is
  // on the disk; if false, there is no file.
  bool uncompressTo(const std::string& path);

  // The body; valid until the next fetch or the end of this object.
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
