// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/fakes/FailingAllocations.h"

#include <cstdlib>
#include <new>

namespace brenvik {
namespace {

constinit thread_local bool armed = false;
constinit thread_local bool failsAll = false;
constinit thread_local long untilFailure = 0;
constinit thread_local long failed = 0;

[[maybe_unused]] bool failsNow() noexcept {
  if (!armed || untilFailure-- > 0) return false;
  if (untilFailure != -1 && !failsAll) return false;
  ++failed;
  return true;
}

}  // namespace

FailingAllocations::FailingAllocations(long first, HowMany howMany) noexcept {
  failsAll = howMany == HowMany::all;
  untilFailure = first;
  failed = 0;
  armed = true;
}

FailingAllocations::~FailingAllocations() { armed = false; }

long FailingAllocations::failures() noexcept { return failed; }

}  // namespace brenvik

#ifndef __SANITIZE_THREAD__
// Not inlined: g++ would see a free() of what new has made.
[[gnu::noinline]] void* operator new(std::size_t size) {
  if (!brenvik::failsNow()) {
    if (void* const block = std::malloc(size == 0 ? 1 : size)) return block;
  }
  throw std::bad_alloc();
}
[[gnu::noinline]] void* operator new(std::size_t size, const std::nothrow_t&) noexcept {
  return brenvik::failsNow() ? nullptr : std::malloc(size == 0 ? 1 : size);
}
[[gnu::noinline]] void operator delete(void* block) noexcept { std::free(block); }
[[gnu::noinline]] void operator delete(void* block, std::size_t) noexcept { std::free(block); }
#endif
