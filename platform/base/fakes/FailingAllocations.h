// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// Lets operator new fail on the thread that made this object, from its allocation number `first` (0: the next
// one) on. A test program that uses it has operator new replaced; not under ThreadSanitizer, which has that
// to itself: nothing fails there.
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

  // How many have failed since.
  static long failures() noexcept;
};

}  // namespace brenvik
