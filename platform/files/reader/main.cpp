// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// brenvik-archive-reader: reads the zip archive on standard input (a regular file) and writes what is in it
// to standard output, as frames (ArchiveFrames.h). Has no arguments, opens nothing, and leaves as soon as
// nobody listens.
#include <fcntl.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <clocale>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>

#include "ArchiveReading.h"
#include "Confinement.h"
#include "platform/files/archive/ArchiveFrames.h"

namespace brenvik {
namespace {

using archive_frame::Head;
using archive_frame::Type;

constexpr std::size_t kGatherUpTo = archive_frame::kLargeChunk;  // small frames go out together
constexpr std::size_t kPiece = 256 << 10;

[[noreturn]] void leave(int status) { ::_exit(status); }

// Frames on their way to the pipe. A reader without a listener has nothing left to do and leaves.
class Output final : public FrameOutput {
 public:
  void frame(Type type, const void* bytes, std::size_t length) override {
    const Head head{type, static_cast<std::uint32_t>(length)};
    gather(&head, sizeof head);
    if (length >= kGatherUpTo) {
      flush();
      for (auto* at = static_cast<const char*>(bytes); length > 0;) {
        const std::size_t part = std::min(length, kPiece);
        lend(at, part);
        at += part;
        length -= part;
      }
    } else {
      gather(bytes, length);
    }
  }
  void flush() override {
    writeAll(gathered_.data(), gathered_.size());
    gathered_.clear();
  }

 private:
  void gather(const void* bytes, std::size_t length) {
    gathered_.append(static_cast<const char*>(bytes), length);
    if (gathered_.size() >= kGatherUpTo) flush();
  }
  // Puts a copy of the bytes into the pipe as the pages they stand in, so that the kernel copies them once,
  // into the file. Such a page must not change before it has left the pipe: it is used again only when more
  // than the pipe holds has been put into it since.
  void lend(const char* bytes, std::size_t length) {
    constexpr std::size_t kPage = 4096;
    alignas(kPage) static char pages[2 * archive_frame::kPipe];
    static_assert(sizeof pages >= archive_frame::kPipe + 3 * kPiece);
    if (position_ + length > sizeof pages) position_ = 0;
    char* at = pages + position_;
    std::memcpy(at, bytes, length);
    position_ += (length + kPage - 1) / kPage * kPage;
    while (canLend_ && length > 0) {
      const iovec one{at, length};
      const ssize_t put = ::vmsplice(STDOUT_FILENO, &one, 1, 0);
      if (put < 0 && errno == EINTR) continue;
      if (put < 0 && errno == EPIPE) leave(1);
      if (put <= 0) {
        canLend_ = false;  // a service manager's filter
        break;
      }
      at += put;
      length -= static_cast<std::size_t>(put);
    }
    // From a page's start as well: from elsewhere the kernel's copying takes 1.7 times as long.
    writeAll(at, length);
  }
  static void writeAll(const char* bytes, std::size_t length) {
    while (length > 0) {
      const ssize_t put = ::write(STDOUT_FILENO, bytes, length);
      if (put < 0 && errno == EINTR) continue;
      if (put <= 0) leave(1);
      bytes += put;
      length -= static_cast<std::size_t>(put);
    }
  }
  std::string gathered_;
  std::size_t position_ = 0;  // of the next page to lend
  // A pipe that holds more than the pages do would have them change in it.
  bool canLend_ = ::fcntl(STDOUT_FILENO, F_GETPIPE_SZ) <= archive_frame::kPipe;
};

[[noreturn]] void run() {
  // Before anything else, or the first name that is not ASCII ends the archive without a word.
  if (std::setlocale(LC_CTYPE, "C.UTF-8") == nullptr || ::setenv("TZ", "UTC0", 1) != 0) leave(1);
  ::tzset();
  if (!confineThisProcess()) leave(1);

  Output out;
  leave(readArchive(STDIN_FILENO, out) ? 0 : 1);
}

}  // namespace
}  // namespace brenvik

int main() {
  try {
    brenvik::run();
  } catch (...) {
    ::_exit(1);
  }
}
