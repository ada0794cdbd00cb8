// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <cstring>
#include <string_view>

#include "platform/ipc/RegionAllocator.h"

namespace brenvik {

// A serialized property list (XML, no terminating NUL) in a region of its own, for a reply. On success the
// reply carries it out of line, and the client then owns it. Address and length 0: no value.
struct OutOfLinePayload {
  void* address = nullptr;
  std::uint32_t length = 0;  // bytes
};

// Copies serialized bytes into a new region. Always sets payload->length; sets payload->address only on
// success. On failure returns the allocator's code, and there is nothing to free.
inline KernelReturn fillPayload(RegionAllocator& regions, std::string_view bytes,
                                OutOfLinePayload* payload) noexcept {
  payload->length = static_cast<std::uint32_t>(bytes.size());
  void* address = nullptr;
  const KernelReturn code = regions.allocate(&address, bytes.size());
  if (code != kern::success) return code;
  payload->address = address;
  if (address != nullptr) std::memcpy(address, bytes.data(), bytes.size());
  return kern::success;
}

}  // namespace brenvik
