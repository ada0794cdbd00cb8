// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <unordered_map>

namespace brenvik {

// How often an account may be refused: each refusal costs the main loop a look at the caller and at the
// entitlement files. An account beyond its limit is not refused faster, it waits.
class RefusalLimit {
 public:
  using Time = std::chrono::steady_clock::time_point;

  // More than a person or a script causes by accident; what is left of the processor for others stays above
  // 99 %.
  static constexpr int kBurst = 50;
  static constexpr std::chrono::milliseconds kOneMoreEvery{50};

  // Whether a check-in of the account may be looked at now.
  bool allows(uid_t account, Time now) const noexcept;
  // One was refused.
  void refused(uid_t account, Time now) noexcept;

  std::size_t accounts() const noexcept { return paidUntil_.size(); }

 private:
  // Accounts remembered: more than a machine has that may connect. Beyond it, those are forgotten that
  // have been quiet long enough.
  static constexpr std::size_t kMaxAccounts = 1024;

  // When the last refusal will have been paid for, at one in kOneMoreEvery.
  std::unordered_map<uid_t, Time> paidUntil_;
};

}  // namespace brenvik
