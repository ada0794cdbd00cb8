// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/Durability.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

int outcomeOf(int result) noexcept {
  if (result == 0) return 0;
  // No file system of a disk says so.
  return errno == EINVAL || errno == ENOSYS || errno == EOPNOTSUPP || errno == EROFS ? 0 : errno;
}

}  // namespace

int syncFile(int file) noexcept { return outcomeOf(::fsync(file)); }

int syncNames(int directory) noexcept {
  const UniqueFd open(::openat(directory, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return open.isValid() ? syncFile(open.get()) : errno;
}

int syncFileSystem(int item) noexcept { return outcomeOf(::syncfs(item)); }

}  // namespace brenvik
