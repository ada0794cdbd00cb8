// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>

#include "interface/Wire.h"

namespace brenvik {

// Memory for out-of-line regions of replies. A region handed to a reply is released by the transport once the
// reply has gone out, or cannot; nobody else frees it. Main loop only.
class RegionAllocator {
 public:
  virtual ~RegionAllocator() = default;
  // A fresh writable region of `length` bytes, anywhere; *address is null on failure. Its bytes are undefined
  // until written: the caller fills it whole.
  virtual KernelReturn allocate(void** address, std::size_t length) noexcept = 0;
  // Releases a region that no reply carries.
  virtual void deallocate(void* address, std::size_t length) noexcept = 0;
};

}  // namespace brenvik
