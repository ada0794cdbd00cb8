// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// brenvik-archive-reader: reads the zip archive on standard input (a regular file) and writes what is in it
// to standard output, as frames (ArchiveFrames.h). Has no arguments, opens nothing, and leaves as soon as
// nobody listens. Whether an entry may be unpacked is not decided here.
#include <archive.h>
#include <archive_entry.h>
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

#include "Confinement.h"
#include "platform/files/archive/ArchiveFrames.h"

namespace brenvik {
namespace {

using archive_frame::EntryHead;
using archive_frame::Head;
using archive_frame::Kind;
using archive_frame::Refusal;
using archive_frame::Type;

constexpr std::size_t kReadBlock = 128 << 10;
constexpr std::size_t kGatherUpTo = archive_frame::kLargeChunk;  // small frames go out together
constexpr std::size_t kPiece = 256 << 10;

[[noreturn]] void leave(int status) { ::_exit(status); }

// Frames on their way to the pipe. A reader without a listener has nothing left to do and leaves.
class Output {
 public:
  void frame(Type type, const void* bytes, std::size_t length) {
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
  // In chunks of a size that the other side takes.
  void chunks(Type type, const char* bytes, std::size_t length) {
    while (length > 0) {
      const std::size_t part = std::min<std::size_t>(length, archive_frame::kLargestChunk);
      frame(type, bytes, part);
      bytes += part;
      length -= part;
    }
  }
  void flush() {
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

void refuse(Output& out, int code, const char* path) {
  const std::string name(path == nullptr ? "" : path,
                         path == nullptr ? 0 : ::strnlen(path, archive_frame::kLongestPath));
  const Refusal refusal{code};
  std::string bytes(sizeof refusal, '\0');
  std::memcpy(bytes.data(), &refusal, sizeof refusal);
  out.frame(Type::refused, (bytes + name).data(), bytes.size() + name.size());
}

[[noreturn]] void fail(Output& out, int code) {
  const Refusal refusal{code};
  out.frame(Type::failed, &refusal, sizeof refusal);
  out.flush();
  leave(1);
}

int codeOf(archive* from) {
  const int code = ::archive_errno(from);
  return code > 0 && code < 4096 ? code : EIO;  // the library has codes of its own, which are negative
}

// What the entry is, or why it is not handed over.
int describe(archive_entry* entry, EntryHead* head, std::string* names) {
  const char* const path = ::archive_entry_pathname_utf8(entry);
  if (path == nullptr) return EILSEQ;
  std::size_t pathLength = std::strlen(path);
  if (pathLength > archive_frame::kLongestPath) return ENAMETOOLONG;
  if (::archive_entry_is_encrypted(entry) != 0 || ::archive_entry_hardlink(entry) != nullptr) return EACCES;
  if ((::archive_entry_perm(entry) & 06000) != 0) return EPERM;
  std::string target;
  switch (::archive_entry_filetype(entry)) {
    case AE_IFREG:
      head->kind = Kind::file;
      break;
    case AE_IFDIR:
      head->kind = Kind::directory;
      if (pathLength > 0 && path[pathLength - 1] == '/') --pathLength;
      break;
    case AE_IFLNK: {
      head->kind = Kind::link;
      const char* const text = ::archive_entry_symlink_utf8(entry);
      if (text == nullptr) return EILSEQ;
      target = text;
      if (target.size() > archive_frame::kLongestPath) return ENAMETOOLONG;
      break;
    }
    default:
      return EPERM;
  }
  head->size =
      head->kind == Kind::file && ::archive_entry_size_is_set(entry) != 0 && ::archive_entry_size(entry) >= 0
          ? static_cast<std::uint64_t>(::archive_entry_size(entry))
          : archive_frame::kUnknownSize;
  head->modified =
      ::archive_entry_mtime_is_set(entry) != 0 ? ::archive_entry_mtime(entry) : archive_frame::kNoTime;
  head->mode = static_cast<std::uint16_t>(::archive_entry_perm(entry) & 0777);  // the sticky bit is left out
  head->pathLength = static_cast<std::uint16_t>(pathLength);
  head->targetLength = static_cast<std::uint16_t>(target.size());
  names->assign(path, pathLength);
  *names += target;
  return 0;
}

void handOver(Output& out, archive* from, archive_entry* entry, const EntryHead& head,
              const std::string& names) {
  std::string bytes(sizeof head, '\0');
  std::memcpy(bytes.data(), &head, sizeof head);
  bytes += names;
  out.frame(Type::entry, bytes.data(), bytes.size());
  std::size_t companionSize = 0;
  const void* const companion = ::archive_entry_mac_metadata(entry, &companionSize);
  if (companion != nullptr && companionSize <= archive_frame::kLargestCompanion) {
    out.chunks(Type::companion, static_cast<const char*>(companion), companionSize);
  }
  if (head.kind == Kind::file) {
    for (;;) {
      const void* block = nullptr;
      std::size_t size = 0;
      la_int64_t offset = 0;
      const int result = ::archive_read_data_block(from, &block, &size, &offset);
      if (result == ARCHIVE_EOF) break;
      if (result != ARCHIVE_OK) fail(out, codeOf(from));  // a warning, too: a checksum or a length is wrong
      out.chunks(Type::data, static_cast<const char*>(block), size);
    }
  }
  out.frame(Type::endOfEntry, nullptr, 0);
}

// An archive without entries is nothing but the end of its directory, which the library does not take for
// one.
bool isEmptyArchive() {
  constexpr std::size_t kSize = 22;
  char bytes[kSize + 1];
  const ssize_t got = ::read(STDIN_FILENO, bytes, sizeof bytes);
  if (::lseek(STDIN_FILENO, 0, SEEK_SET) != 0) leave(1);
  if (got != kSize || std::memcmp(bytes, "PK\5\6", 4) != 0) return false;
  return std::all_of(bytes + 4, bytes + kSize, [](char byte) { return byte == 0; });
}

[[noreturn]] void run() {
  // Before anything else, or the first name that is not ASCII ends the archive without a word.
  if (std::setlocale(LC_CTYPE, "C.UTF-8") == nullptr || ::setenv("TZ", "UTC0", 1) != 0) leave(1);
  ::tzset();
  if (!confineThisProcess()) leave(1);

  Output out;
  if (isEmptyArchive()) {
    out.frame(Type::end, nullptr, 0);
    out.flush();
    leave(0);
  }
  archive* const from = ::archive_read_new();
  // By the central directory only: what a broken one leaves is not guessed at. With "mac-ext" the companion
  // entries come along with their files.
  if (from == nullptr || ::archive_read_support_format_zip_seekable(from) != ARCHIVE_OK ||
      ::archive_read_set_options(from, "zip:mac-ext") != ARCHIVE_OK) {
    fail(out, ENOMEM);
  }
  if (::archive_read_open_fd(from, STDIN_FILENO, kReadBlock) != ARCHIVE_OK) fail(out, codeOf(from));
  for (;;) {
    archive_entry* entry = nullptr;
    const int result = ::archive_read_next_header(from, &entry);
    if (result == ARCHIVE_EOF) break;
    if (result != ARCHIVE_OK && result != ARCHIVE_WARN) fail(out, codeOf(from));
    EntryHead head{};
    std::string names;
    const int code = result == ARCHIVE_WARN ? EILSEQ : describe(entry, &head, &names);
    if (code != 0) {
      refuse(out, code, ::archive_entry_pathname_utf8(entry));
      continue;
    }
    // The folder of the companion entries, which came along already.
    if (head.kind == Kind::directory && (names == "__MACOSX" || names.starts_with("__MACOSX/"))) continue;
    handOver(out, from, entry, head, names);
  }
  out.frame(Type::end, nullptr, 0);
  out.flush();
  leave(0);
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
