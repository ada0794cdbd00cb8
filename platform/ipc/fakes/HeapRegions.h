// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <map>
#include <memory>
#include <new>
#include <string>

#include "platform/ipc/RegionAllocator.h"

namespace brenvik {

// Regions on the heap, counted; refuses with a code of the test's choosing, and when memory runs out.
class HeapRegions final : public RegionAllocator {
 public:
  KernelReturn allocate(void** address, std::size_t length) noexcept override try {
    ++calls;
    lastLength = length;
    *address = nullptr;
    if (refuseWith != kern::success) return refuseWith;
    auto bytes = std::make_unique<char[]>(length == 0 ? 1 : length);
    void* const start = bytes.get();
    live_.emplace(start, std::move(bytes));
    *address = start;
    return kern::success;
  } catch (const std::bad_alloc&) {
    return kern::resourceShortage;
  }
  void deallocate(void* address, std::size_t) noexcept override { live_.erase(address); }

  std::size_t live() const noexcept { return live_.size(); }

  KernelReturn refuseWith = kern::success;
  int calls = 0;
  std::size_t lastLength = 0;

 private:
  std::map<void*, std::unique_ptr<char[]>> live_;
};

}  // namespace brenvik
