// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// The folder of one store below the home of "mobile", as the helper looks for it: by held descriptors, one
// name at a time. Main thread.
class StoreFolder {
 public:
  enum class IfMissing { fail, create };
  enum class State {
    open,
    missing,   // there is no such folder, or no home
    unusable,  // something else stands there, or it cannot be made
    outOfMemory
  };
  struct Opened {
    UniqueFd descriptor;
    // Which folder it is, for as long as a descriptor of it is open.
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
    bool isSameAs(const Opened& other) const noexcept {
      return device == other.device && inode == other.inode;
    }
  };

  virtual ~StoreFolder() = default;
  // *folder is set with State::open only.
  virtual State open(IfMissing ifMissing, Opened* folder) noexcept = 0;
  // Gives the folder and the store's files in it to "mobile" where they are root's, and either nobody but
  // root can have put them there or everybody may read them. True when something was given.
  virtual bool prepare(const Opened& folder) noexcept = 0;
};

}  // namespace brenvik
