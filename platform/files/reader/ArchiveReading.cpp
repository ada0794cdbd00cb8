// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "ArchiveReading.h"

#include <archive.h>
#include <archive_entry.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <string>

namespace brenvik {

void FrameOutput::chunks(archive_frame::Type type, const char* bytes, std::size_t length) {
  while (length > 0) {
    const std::size_t part = std::min<std::size_t>(length, archive_frame::kLargestChunk);
    frame(type, bytes, part);
    bytes += part;
    length -= part;
  }
}

namespace {

using archive_frame::EntryHead;
using archive_frame::Kind;
using archive_frame::Refusal;
using archive_frame::Type;

constexpr std::size_t kReadBlock = 128 << 10;

struct FreeArchive {
  void operator()(archive* from) const noexcept { (void)::archive_read_free(from); }
};

void refuse(FrameOutput& out, int code, const char* path) {
  const std::string name(path == nullptr ? "" : path,
                         path == nullptr ? 0 : ::strnlen(path, archive_frame::kLongestPath));
  const Refusal refusal{code};
  std::string bytes(sizeof refusal, '\0');
  std::memcpy(bytes.data(), &refusal, sizeof refusal);
  out.frame(Type::refused, (bytes + name).data(), bytes.size() + name.size());
}

bool fail(FrameOutput& out, int code) {
  const Refusal refusal{code};
  out.frame(Type::failed, &refusal, sizeof refusal);
  out.flush();
  return false;
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

// Returns 0, or the errno value that ends the archive.
int handOver(FrameOutput& out, archive* from, archive_entry* entry, const EntryHead& head,
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
      if (result != ARCHIVE_OK) return codeOf(from);  // a warning, too: a checksum or a length is wrong
      out.chunks(Type::data, static_cast<const char*>(block), size);
    }
  }
  out.frame(Type::endOfEntry, nullptr, 0);
  return 0;
}

// An archive without entries is nothing but the end of its directory, which the library does not take for
// one. Returns false if the file cannot be read from its beginning again.
bool lookForEmptyArchive(int file, bool* isEmpty) {
  constexpr std::size_t kSize = 22;
  char bytes[kSize + 1];
  const ssize_t got = ::read(file, bytes, sizeof bytes);
  *isEmpty = got == kSize && std::memcmp(bytes, "PK\5\6", 4) == 0 &&
             std::all_of(bytes + 4, bytes + kSize, [](char byte) { return byte == 0; });
  return ::lseek(file, 0, SEEK_SET) == 0;
}

}  // namespace

bool readArchive(int file, FrameOutput& out) {
  bool isEmpty = false;
  if (!lookForEmptyArchive(file, &isEmpty)) return false;
  if (isEmpty) {
    out.frame(Type::end, nullptr, 0);
    out.flush();
    return true;
  }
  const std::unique_ptr<archive, FreeArchive> owner(::archive_read_new());
  archive* const from = owner.get();
  // By the central directory only: what a broken one leaves is not guessed at. With "mac-ext" the companion
  // entries come along with their files.
  if (from == nullptr || ::archive_read_support_format_zip_seekable(from) != ARCHIVE_OK ||
      ::archive_read_set_options(from, "zip:mac-ext") != ARCHIVE_OK) {
    return fail(out, ENOMEM);
  }
  if (::archive_read_open_fd(from, file, kReadBlock) != ARCHIVE_OK) return fail(out, codeOf(from));
  for (;;) {
    archive_entry* entry = nullptr;
    const int result = ::archive_read_next_header(from, &entry);
    if (result == ARCHIVE_EOF) break;
    if (result != ARCHIVE_OK && result != ARCHIVE_WARN) return fail(out, codeOf(from));
    EntryHead head{};
    std::string names;
    const int code = result == ARCHIVE_WARN ? EILSEQ : describe(entry, &head, &names);
    if (code != 0) {
      refuse(out, code, ::archive_entry_pathname_utf8(entry));
      continue;
    }
    // The folder of the companion entries, which came along already.
    if (head.kind == Kind::directory && (names == "__MACOSX" || names.starts_with("__MACOSX/"))) continue;
    if (const int ended = handOver(out, from, entry, head, names); ended != 0) return fail(out, ended);
  }
  out.frame(Type::end, nullptr, 0);
  out.flush();
  return true;
}

}  // namespace brenvik
