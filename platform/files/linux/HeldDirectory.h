// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// How many levels of a tree keep their descriptors open during a walk. Deeper ones close those far above and
// come back through "..", so that no tree can use up the process's descriptors.
inline constexpr std::size_t kHeldLevels = 48;

// A directory of a walk. Its descriptor may be closed, and opened again from a directory inside it.
class HeldDirectory {
 public:
  HeldDirectory() = default;
  explicit HeldDirectory(UniqueFd fd) : fd_(std::move(fd)) {}

  int get() const noexcept { return fd_.get(); }

  // Closes the descriptor, remembering which directory it was. 0 or errno; kept open on failure.
  int giveUp() noexcept;
  // Opens it again as the parent of `child`. 0 or errno; ESTALE when the child was moved elsewhere meanwhile.
  int takeAgain(int child) noexcept;

 private:
  UniqueFd fd_;
  dev_t device_ = 0;
  ino_t inode_ = 0;
};

}  // namespace brenvik
