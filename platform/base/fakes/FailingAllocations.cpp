// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/fakes/FailingAllocations.h"

#include <cstdlib>
#include <new>

#include "platform/base/fakes/AllocationFailures.h"

namespace brenvik {
namespace {

constinit thread_local AllocationFailures failing;

}  // namespace

FailingAllocations::FailingAllocations(long first, HowMany howMany) noexcept {
  failing.arm(first, howMany == HowMany::all);
}

FailingAllocations::~FailingAllocations() { failing.isArmed = false; }

FailingAllocations::Pause::Pause() noexcept : wasArmed_(failing.isArmed) { failing.isArmed = false; }

FailingAllocations::Pause::~Pause() { failing.isArmed = wasArmed_; }

long FailingAllocations::failures() noexcept { return failing.failed; }

}  // namespace brenvik

#ifndef __SANITIZE_THREAD__
// Not inlined: g++ would see a free() of what new has made.
[[gnu::noinline]] void* operator new(std::size_t size) {
  if (!brenvik::failing.takeTurn()) {
    if (void* const block = std::malloc(size == 0 ? 1 : size)) return block;
  }
  throw std::bad_alloc();
}
[[gnu::noinline]] void* operator new(std::size_t size, const std::nothrow_t&) noexcept {
  return brenvik::failing.takeTurn() ? nullptr : std::malloc(size == 0 ? 1 : size);
}
[[gnu::noinline]] void operator delete(void* block) noexcept { std::free(block); }
[[gnu::noinline]] void operator delete(void* block, std::size_t) noexcept { std::free(block); }
#endif
