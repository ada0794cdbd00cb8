// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// The folder of one store below the home of "mobile". The helper looks for it with open descriptors, one name
// at a time. Main thread.
class StoreFolder {
 public:
  enum class IfMissing { fail, create };
  enum class State {
    open,
    missing,   // there is no such folder, or no home
    unusable,  // there is another item with that name, or the folder cannot be made
    outOfMemory
  };
  struct Opened {
    UniqueFd descriptor;
    // Identify the folder as long as a descriptor of it is open.
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
    bool isSameAs(const Opened& other) const noexcept {
      return device == other.device && inode == other.inode;
    }
  };

  virtual ~StoreFolder() = default;
  // Sets *folder only for State::open.
  virtual State open(IfMissing ifMissing, Opened* folder) noexcept = 0;
  // Gives the folder and the store's files in it to "mobile" if root owns them, and if nobody but root can
  // have put them there or everybody may read them. Returns true if it changed an owner.
  virtual bool prepare(const Opened& folder) noexcept = 0;
};

}  // namespace brenvik
