// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define BRENVIK_MALLOC_IS_TAKEN
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define BRENVIK_MALLOC_IS_TAKEN
#endif
#endif

namespace brenvik {

// Makes malloc(3), calloc(3) and realloc(3) fail, and so operator new and the allocations of C libraries, on
// the thread that made this object, from its allocation number `first` (0: the next one) on. It replaces
// these functions in test programs that use it, except under a sanitizer, which needs its own: there, nothing
// fails.
class FailingMalloc {
 public:
  enum class HowMany { one, all };
#ifdef BRENVIK_MALLOC_IS_TAKEN
  static constexpr bool kWork = false;
#else
  static constexpr bool kWork = true;
#endif

  FailingMalloc(long first, HowMany howMany) noexcept;
  ~FailingMalloc();
  FailingMalloc(const FailingMalloc&) = delete;
  FailingMalloc& operator=(const FailingMalloc&) = delete;

  // While it lives, no allocation fails or is counted. For a test's own allocations.
  class Pause {
   public:
    Pause() noexcept;
    ~Pause();
    Pause(const Pause&) = delete;
    Pause& operator=(const Pause&) = delete;

   private:
    const bool wasArmed_;
  };

  // The number of allocations that have failed since the latest object was made.
  static long failures() noexcept;
};

}  // namespace brenvik
