// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <unordered_map>

namespace brenvik {

// Limits how often an account is refused, because each refusal makes the main loop examine the caller and the
// entitlement files. An account beyond its limit waits for its refusals.
class RefusalLimit {
 public:
  using Time = std::chrono::steady_clock::time_point;

  // More than a person or a script causes by accident, and still less than 1 % of the processor's time.
  static constexpr int kBurst = 50;
  static constexpr std::chrono::milliseconds kOneMoreEvery{50};

  // Whether a check-in of the account may be examined now.
  bool allows(uid_t account, Time now) const noexcept;
  // Records that a check-in of the account was refused.
  void refused(uid_t account, Time now) noexcept;

  std::size_t accounts() const noexcept { return paidUntil_.size(); }

 private:
  // The most accounts remembered; a machine has fewer that may connect. Beyond it, accounts that have been
  // quiet long enough are forgotten.
  static constexpr std::size_t kMaxAccounts = 1024;

  // When each account's refusals are paid off, at one refusal every kOneMoreEvery.
  std::unordered_map<uid_t, Time> paidUntil_;
};

}  // namespace brenvik
