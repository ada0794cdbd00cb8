// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/fakes/FailingMalloc.h"

#include <cerrno>
#include <cstddef>
#include <utility>

#include "platform/base/fakes/AllocationFailures.h"

namespace brenvik {
namespace {

constinit thread_local AllocationFailures failing;

[[maybe_unused]] bool failsNow() noexcept {
  if (!failing.takeTurn()) return false;
  errno = ENOMEM;
  return true;
}

}  // namespace

FailingMalloc::FailingMalloc(long first, HowMany howMany) noexcept {
  failing.arm(first, howMany == HowMany::all);
}

FailingMalloc::~FailingMalloc() { failing.isArmed = false; }

FailingMalloc::Pause::Pause() noexcept : wasArmed_(std::exchange(failing.isArmed, false)) {}

FailingMalloc::Pause::~Pause() { failing.isArmed = wasArmed_; }

long FailingMalloc::failures() noexcept { return failing.failed; }

}  // namespace brenvik

#ifndef BRENVIK_MALLOC_IS_TAKEN
extern "C" {
// The names under which the C library keeps its own functions reachable.
// NOLINTBEGIN(bugprone-reserved-identifier)
void* __libc_malloc(std::size_t size);
void* __libc_calloc(std::size_t count, std::size_t size);
void* __libc_realloc(void* memory, std::size_t size);
// NOLINTEND(bugprone-reserved-identifier)
void* malloc(std::size_t size) { return brenvik::failsNow() ? nullptr : __libc_malloc(size); }
void* calloc(std::size_t count, std::size_t size) {
  return brenvik::failsNow() ? nullptr : __libc_calloc(count, size);
}
void* realloc(void* memory, std::size_t size) {
  return brenvik::failsNow() ? nullptr : __libc_realloc(memory, size);
}
}
#endif
