// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/HeldDirectory.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

namespace brenvik {

int HeldDirectory::giveUp() noexcept {
  if (!fd_.isValid()) return 0;
  struct stat info {};
  if (::fstat(fd_.get(), &info) != 0) return errno;
  device_ = info.st_dev;
  inode_ = info.st_ino;
  fd_.reset();
  return 0;
}

int HeldDirectory::takeAgain(int child) noexcept {
  if (fd_.isValid()) return 0;
  UniqueFd parent(::openat(child, "..", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  struct stat info {};
  if (!parent.isValid() || ::fstat(parent.get(), &info) != 0) return errno;
  // Somebody who moves a directory during the walk must not lead it out of the tree.
  if (info.st_dev != device_ || info.st_ino != inode_) return ESTALE;
  fd_ = std::move(parent);
  return 0;
}

}  // namespace brenvik
