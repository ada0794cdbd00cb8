// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>

#include "interface/Wire.h"

namespace brenvik {

// Memory for out-of-line regions of replies. The transport releases a region of a reply once the reply was
// sent or cannot be sent; nobody else frees it. Main loop only.
class RegionAllocator {
 public:
  virtual ~RegionAllocator() = default;
  // Allocates a writable region of `length` bytes. On failure *address is null. The bytes are undefined: the
  // caller must write all of them.
  virtual KernelReturn allocate(void** address, std::size_t length) noexcept = 0;
  // Releases a region that no reply carries.
  virtual void deallocate(void* address, std::size_t length) noexcept = 0;
};

}  // namespace brenvik
