// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/lasd/HttpFetcher.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <cerrno>
#include <condition_variable>
#include <cstdio>
#include <cstring>
#include <exception>
#include <mutex>
#include <utility>

#include "platform/base/UniqueFd.h"
#include "platform/log/Log.h"
#include "platform/log/LogContext.h"

namespace brenvik {
namespace {

constexpr const char kQueueLabel[] = "com.norvale.httpdownloadqueue";
constexpr const char kContentType[] = "Content-Type";
constexpr const char kGzip[] = "gzip";

// Counts up to signal() and down from wait().
class Semaphore {
 public:
  void signal() {
    // Within the lock: the waiter may let go of the semaphore as soon as it sees the count.
    const std::lock_guard lock(mutex_);
    ++count_;
    changed_.notify_one();
  }
  void wait() {
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [this] { return count_ > 0; });
    --count_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  int count_ = 0;
};

// A regular file to be written from its beginning; errno says why there is none.
UniqueFd openOutput(const char* path) {
  // The folder may be writable by others: a link planted there would lead the writing astray, and a pipe
  // would hold it for ever.
  UniqueFd file(::open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0644));
  struct stat status {};
  if (file.isValid() && ::fstat(file.get(), &status) == 0 && !S_ISREG(status.st_mode)) {
    file.reset();
    errno = EINVAL;
  }
  return file;
}

// What was written for us stands there, whoever says so.
bool hasSize(int file, std::uint64_t size) noexcept {
  struct stat status {};
  return ::fstat(file, &status) == 0 && static_cast<std::uint64_t>(status.st_size) == size;
}

void tellWriteError(const std::string& path) {
  logUnified(LogLevel::error, "Cannot write output file %s: %s", path.c_str(), std::strerror(errno));
}

// What does not fit is unpacked so far all the same, to nowhere, so that somebody can be told how much room
// it needs. A few seconds of work; a bomb ends there.
constexpr std::uint64_t kMaxCountedBeyondRoom = std::uint64_t{1} << 30;

}  // namespace

DiskSpace diskSpaceOf(int file) noexcept {
  struct statvfs disk {};
  if (::fstatvfs(file, &disk) != 0) return {};
  return {std::uint64_t{disk.f_blocks} * disk.f_frsize, std::uint64_t{disk.f_bavail} * disk.f_frsize};
}

HttpFetcher::HttpFetcher(const Parts& parts)
    : parts_(parts), queue_(parts.queues.makeSerial(kQueueLabel, QualityOfService::utility)) {}

bool HttpFetcher::fetch(const std::string& url, WifiOnly wifiOnly, std::uint64_t largestBody) noexcept try {
  body_.clear();
  headers_.clear();
  if (url.empty()) {
    logUnified(LogLevel::error, "URL is empty");
    return false;
  }
  logUnified(LogLevel::info, "Fetching URL %s", url.c_str());
  const HeaderMap requestHeaders{{"Accept-Encoding", "gzip"}};
  const auto session = parts_.web.makeSession();
  if (wifiOnly == WifiOnly::yes) session->setCellularAllowed(false);
  auto request = parts_.web.makeRequest(WebRequestType::get, url, requestHeaders, session);
  // A completion that is waited for on its own queue would never come.
  if (queue_->isCurrent()) request.reset();
  if (request == nullptr) {
    logUnified(LogLevel::error, "Cannot create HTTP request for URL %s", url.c_str());
    return false;
  }
  const auto semaphore = std::make_shared<Semaphore>();
  request->setLargestBody(largestBody);
  request->setCallbackQueue(queue_);
  request->setCompletion(
      [this, url, semaphore, context = LogScope::current()](const std::shared_ptr<WebResponse>& response) {
        const LogScope scope(context);
        completed(url, response);
        semaphore->signal();  // last: the fetcher may be gone afterwards
      });
  request->send({});
  semaphore->wait();
  return !body_.empty();
} catch (const std::exception&) {  // no memory or no thread, and nothing was sent
  logUnified(LogLevel::error, "Cannot create HTTP request for URL %s", url.c_str());
  return false;
}

void HttpFetcher::completed(const std::string& url, const std::shared_ptr<WebResponse>& response) {
  if (response == nullptr) {
    logUnified(LogLevel::error, "Did not receive HTTP response!");
  } else if (response->errorKind == WebErrorKind::none && response->statusCode == 200) {
    body_ = std::move(response->body);
    headers_ = std::move(response->headers);
    logUnified(LogLevel::info, "URL retrieved %s, size: %lu ", url.c_str(),
               static_cast<unsigned long>(body_.size()));
  } else {
    logUnified(LogLevel::error, "HTTP request failed for URL %s with error %s errorcode %d (%s)", url.c_str(),
               textOfErrorKind(response->errorKind), response->statusCode,
               textOfStatusCode(response->statusCode));
  }
}

bool HttpFetcher::uncompressTo(const std::string& path) {
  if (body_.empty()) {
    logUnified(LogLevel::error, "Cannot uncompress downloaded buffer without a response!");
    return false;
  }
  const auto contentType = headers_.find(kContentType);
  if (contentType == headers_.end()) {
    logUnified(LogLevel::error, "Cannot find %s header in response!", kContentType);
    return false;
  }
  // The type, not the encoding: the server keeps the databases as gzip files, and what a client has decoded
  // on the way is none any more.
  if (contentType->second.find(kGzip) == std::string::npos) {
    logUnified(LogLevel::error, "Expected to find %s in %s header, found %s instead", kGzip, kContentType,
               contentType->second.c_str());
    return false;
  }
  UniqueFd file = openOutput(path.c_str());
  if (!file.isValid()) {
    logUnified(LogLevel::error, "Cannot open output file %s: %s", path.c_str(), std::strerror(errno));
    return false;
  }
  // Some errors of a disk show only when what was written has to get there. The version record that follows
  // is written for good, so the database must be before it.
  if (uncompressInto(file.get(), path)) {
    if (::fsync(file.get()) == 0 && ::close(file.release()) == 0) return true;
    tellWriteError(path);
  }
  logUnified(LogLevel::error, "Could not uncompress HTTP response to %s!", path.c_str());
  file.reset();
  if (::remove(path.c_str()) != 0) {
    logUnified(LogLevel::error, "Failed to remove partially uncompressed file at %s: %s", path.c_str(),
               std::strerror(errno));
  }
  return false;
}

bool HttpFetcher::uncompressInto(int file, const std::string& path) {
  const DiskSpace disk = parts_.diskSpace(file);
  const std::uint64_t reserve = diskReserve(disk.size);
  const std::uint64_t room = disk.available > reserve ? disk.available - reserve : 0;
  const auto [result, need, writeError] =
      parts_.gunzip.gunzipInto({body_, body_.sealedMemory()}, file, room, room + kMaxCountedBeyondRoom);
  if (result == GunzipResult::refused) {
    errno = writeError;
    tellWriteError(path);
    return false;
  }
  if (need <= room) return result == GunzipResult::whole && hasSize(file, need);
  // Of a file that turns out to be damaged nobody knows how much room it needs.
  if (result == GunzipResult::whole || result == GunzipResult::tooLarge) {
    logUnified(LogLevel::error,
               "No room for %s: it needs %llu bytes or more, %llu are free beyond the reserve", path.c_str(),
               static_cast<unsigned long long>(need), static_cast<unsigned long long>(room));
  }
  return false;
}

}  // namespace brenvik
