// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Makes operator new fail on the thread that made this object, from its allocation number `first` (0: the
// next one) on. It replaces operator new in test programs that use it, except under ThreadSanitizer, which
// needs its own: there, nothing fails.
class FailingAllocations {
 public:
  enum class HowMany { one, all };
#ifdef __SANITIZE_THREAD__
  static constexpr bool kWork = false;
#else
  static constexpr bool kWork = true;
#endif

  explicit FailingAllocations(long first, HowMany howMany = HowMany::all) noexcept;
  ~FailingAllocations();
  FailingAllocations(const FailingAllocations&) = delete;
  FailingAllocations& operator=(const FailingAllocations&) = delete;

  // While it lives, nothing fails on this thread, and nothing is counted: for what belongs to the test.
  class Pause {
   public:
    Pause() noexcept;
    ~Pause();
    Pause(const Pause&) = delete;
    Pause& operator=(const Pause&) = delete;

   private:
    const bool wasArmed_;
  };

  // The number of allocations that have failed since then.
  static long failures() noexcept;
};

}  // namespace brenvik
