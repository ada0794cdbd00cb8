// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/DirectoryNames.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

namespace brenvik {

int DirectoryNames::load(int directory, std::size_t most) {
  packed_.clear();
  position_ = 0;
  alignas(dirent64) char buffer[16384];
  for (std::size_t count = 0; count < most;) {
    const ssize_t got = ::getdents64(directory, buffer, sizeof buffer);
    if (got < 0) return errno;
    if (got == 0) return 0;
    for (ssize_t at = 0; at < got;) {
      dirent64 entry;
      std::memcpy(&entry, buffer + at, offsetof(dirent64, d_name));
      const char* name = buffer + at + offsetof(dirent64, d_name);
      at += entry.d_reclen;
      if (std::strcmp(name, ".") == 0 || std::strcmp(name, "..") == 0) continue;
      unsigned char type = entry.d_type;
      struct stat info {};
      if (type == DT_UNKNOWN && ::fstatat(directory, name, &info, AT_SYMLINK_NOFOLLOW) == 0) {
        type = static_cast<unsigned char>(IFTODT(info.st_mode));
      }
      packed_ += static_cast<char>(type);
      packed_.append(name, std::strlen(name) + 1);
      ++count;
    }
  }
  return 0;
}

bool DirectoryNames::next(Entry* entry) {
  if (position_ >= packed_.size()) return false;
  entry->type = static_cast<unsigned char>(packed_[position_]);
  entry->name = packed_.data() + position_ + 1;
  position_ += 2 + std::strlen(entry->name);
  return true;
}

}  // namespace brenvik
