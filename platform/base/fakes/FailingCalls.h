// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cerrno>
#include <string_view>

namespace brenvik {

// Lets one call of the C library fail, for errors that no test can bring about by other means. The test
// program defines the call itself, asks failsNow() there and else makes the system call. Of the thread that
// made this object only; the latest object of a call counts.
class FailingCall {
 public:
  enum class HowOften { once, always };

  // The first `skipped` calls are let through.
  FailingCall(std::string_view call, int error, int skipped = 0, HowOften howOften = HowOften::once) noexcept
      : call_(call), error_(error), skipped_(skipped), howOften_(howOften), before_(latest_) {
    latest_ = this;
  }
  ~FailingCall() { latest_ = before_; }
  FailingCall(const FailingCall&) = delete;
  FailingCall& operator=(const FailingCall&) = delete;

  // How often it has failed.
  int failures() const noexcept { return failures_; }

  // For the defined call: whether it is to fail now. Then errno is set.
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
