// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cerrno>
#include <string_view>

namespace brenvik {

// Makes one call of the C library fail, for errors that a test cannot cause otherwise. The test program
// defines the function itself, asks failsNow() in it, and makes the system call if that is false. Only the
// thread that made this object is affected; with several objects for one call, the latest counts.
class FailingCall {
 public:
  enum class HowOften { once, always };

  // The first `skipped` calls succeed.
  FailingCall(std::string_view call, int error, int skipped = 0, HowOften howOften = HowOften::once) noexcept
      : call_(call), error_(error), skipped_(skipped), howOften_(howOften), before_(latest_) {
    latest_ = this;
  }
  ~FailingCall() { latest_ = before_; }
  FailingCall(const FailingCall&) = delete;
  FailingCall& operator=(const FailingCall&) = delete;

  // How often it has failed.
  int failures() const noexcept { return failures_; }

  // For the function that the test program defines. True if it must fail now; errno is set then.
  static bool failsNow(std::string_view call) noexcept {
    for (FailingCall* it = latest_; it != nullptr; it = it->before_) {
      if (it->call_ == call) return it->takeTurn();
    }
    return false;
  }

 private:
  bool takeTurn() noexcept {
    if (skipped_-- > 0) return false;
    if (howOften_ == HowOften::once && failures_ > 0) return false;
    ++failures_;
    errno = error_;
    return true;
  }

  static inline constinit thread_local FailingCall* latest_ = nullptr;
  const std::string_view call_;
  const int error_;
  int skipped_;
  const HowOften howOften_;
  int failures_ = 0;
  FailingCall* const before_;
};

}  // namespace brenvik
