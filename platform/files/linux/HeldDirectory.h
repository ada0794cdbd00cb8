// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// The number of levels of a tree that keep their descriptors open during a walk. A deeper walk closes those
// far above and returns to them through "..", so that no tree can use up the process's descriptors.
inline constexpr std::size_t kHeldLevels = 48;

// A directory of a walk. Its descriptor may be closed, and opened again from a directory inside it.
class HeldDirectory {
 public:
  HeldDirectory() = default;
  explicit HeldDirectory(UniqueFd fd) : fd_(std::move(fd)) {}

  int get() const noexcept { return fd_.get(); }

  // Closes the descriptor and remembers the directory. Returns 0, or an errno and keeps it open.
  int giveUp() noexcept;
  // Opens it again as the parent of `child`. Returns 0 or an errno; ESTALE if the child was moved meanwhile.
  int takeAgain(int child) noexcept;

 private:
  UniqueFd fd_;
  dev_t device_ = 0;
  ino_t inode_ = 0;
};

}  // namespace brenvik
