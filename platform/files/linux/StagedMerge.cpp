// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/StagedMerge.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "platform/base/UniqueFd.h"
#include "platform/files/linux/DirectoryNames.h"

namespace brenvik {
namespace {

constexpr int kOpenDirectory = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

}  // namespace

int checkMerge(int staged, int destination) {
  DirectoryNames names;
  const UniqueFd here(::openat(staged, ".", kOpenDirectory));
  if (!here.isValid()) return errno;
  if (const int error = names.load(here.get()); error != 0) return error;
  for (DirectoryNames::Entry entry{}; names.next(&entry);) {
    struct stat there {};
    if (::fstatat(destination, entry.name, &there, AT_SYMLINK_NOFOLLOW) != 0) {
      if (errno != ENOENT) return errno;
      continue;
    }
    const bool isDirectory = entry.type == DT_DIR;
    if (isDirectory != S_ISDIR(there.st_mode)) return EEXIST;
    if (!isDirectory) continue;
    const UniqueFd from(::openat(here.get(), entry.name, kOpenDirectory));
    const UniqueFd to(::openat(destination, entry.name, kOpenDirectory));
    if (!from.isValid() || !to.isValid()) return errno;
    if (const int error = checkMerge(from.get(), to.get()); error != 0) return error;
  }
  return 0;
}

int mergeStaged(int staged, int destination) {
  DirectoryNames names;
  const UniqueFd here(::openat(staged, ".", kOpenDirectory));
  if (!here.isValid()) return errno;
  if (const int error = names.load(here.get()); error != 0) return error;
  for (DirectoryNames::Entry entry{}; names.next(&entry);) {
    if (entry.type != DT_DIR) {
      if (::renameat(here.get(), entry.name, destination, entry.name) != 0) return errno;
      continue;
    }
    // rename(2) takes a whole directory where there is none; an empty one would give way, and does not here.
    if (::renameat2(here.get(), entry.name, destination, entry.name, RENAME_NOREPLACE) == 0) continue;
    bool isMade = false;
    if (errno == EINVAL || errno == ENOSYS) {
      isMade = ::mkdirat(destination, entry.name, 0700) == 0;
      if (!isMade && errno != EEXIST) return errno;
    } else if (errno != EEXIST) {
      return errno;
    }
    const UniqueFd from(::openat(here.get(), entry.name, kOpenDirectory));
    const UniqueFd to(::openat(destination, entry.name, kOpenDirectory));
    struct stat info {};
    if (!from.isValid() || !to.isValid() || ::fstat(from.get(), &info) != 0) return errno;
    if (isMade && ::fchmod(to.get(), info.st_mode & 0777) != 0) return errno;
    if (const int error = mergeStaged(from.get(), to.get()); error != 0) return error;
  }
  return 0;
}

}  // namespace brenvik
