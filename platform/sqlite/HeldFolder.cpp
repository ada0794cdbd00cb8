// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/sqlite/HeldFolder.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstring>
#include <string_view>
#include <system_error>

namespace brenvik {
namespace {

// No folder has this name; and whoever makes one, or names it in a journal, gets no further than with any
// other path: each call is made with this process's rights.
constexpr std::string_view kPrefix = "/.brenvik-held-folder-";

// Where a path begins, and how it goes on from there.
struct Way {
  int folder = AT_FDCWD;
  const char* rest = nullptr;
};

Way wayOf(const char* path) noexcept {
  const std::size_t length = std::strlen(path);
  if (length <= kPrefix.size() || std::string_view(path, kPrefix.size()) != kPrefix) return {AT_FDCWD, path};
  int folder = -1;
  const char* const end = path + length;
  const auto [stopped, error] = std::from_chars(path + kPrefix.size(), end, folder);
  if (error != std::errc() || folder < 0) return {AT_FDCWD, path};
  if (stopped == end) return {folder, "."};
  return *stopped == '/' && stopped[1] != '\0' ? Way{folder, stopped + 1} : Way{AT_FDCWD, path};
}

// A pipe may stand where a journal belongs, and opening one for reading waits for a writer. For regular files
// the flag means nothing.
int openWithoutWaiting(const char* path, int flags, int mode) noexcept {
  const Way way = wayOf(path);
  return ::openat(way.folder, way.rest, flags | O_NONBLOCK, static_cast<mode_t>(mode));
}

int statFile(const char* path, struct stat* info) noexcept {
  const Way way = wayOf(path);
  return ::fstatat(way.folder, way.rest, info, 0);
}

int statLink(const char* path, struct stat* info) noexcept {
  const Way way = wayOf(path);
  return ::fstatat(way.folder, way.rest, info, AT_SYMLINK_NOFOLLOW);
}

int accessFile(const char* path, int mode) noexcept {
  const Way way = wayOf(path);
  return ::faccessat(way.folder, way.rest, mode, 0);
}

int unlinkFile(const char* path) noexcept {
  const Way way = wayOf(path);
  return ::unlinkat(way.folder, way.rest, 0);
}

ssize_t readLink(const char* path, char* target, std::size_t size) noexcept {
  const Way way = wayOf(path);
  return ::readlinkat(way.folder, way.rest, target, size);
}

}  // namespace

std::string pathInHeldFolder(int folder, const char* name) {
  return std::string(kPrefix) + std::to_string(folder) + "/" + name;
}

bool understandHeldFolders(void* files, SqliteSetSystemCall set) noexcept {
  const struct {
    const char* name;
    void (*function)();
  } calls[] = {{"open", reinterpret_cast<void (*)()>(&openWithoutWaiting)},
               {"stat", reinterpret_cast<void (*)()>(&statFile)},
               {"lstat", reinterpret_cast<void (*)()>(&statLink)},
               {"access", reinterpret_cast<void (*)()>(&accessFile)},
               {"unlink", reinterpret_cast<void (*)()>(&unlinkFile)},
               {"readlink", reinterpret_cast<void (*)()>(&readLink)}};
  for (const auto& call : calls) {
    if (!set(files, call.name, call.function)) return false;
  }
  return true;
}

}  // namespace brenvik
