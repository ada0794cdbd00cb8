// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <utility>

#include "platform/log/LogContext.h"

namespace brenvik {

// Logs refused callers without letting them fill the log. A caller is an account with an executable. It gets
// a line for its first refusal, and then at most one a minute, with the number of refusals that were not
// logged. Beyond kMaxCallers callers at a time, all others count as one. Any thread.
class RefusalLog {
 public:
  using Clock = std::function<std::chrono::nanoseconds()>;

  static constexpr std::chrono::minutes kInterval{1};
  static constexpr std::size_t kMaxCallers = 64;

  explicit RefusalLog(Clock now) : now_(std::move(now)) {}

  // Records that a caller was refused. `why` is called only if a line is written. Throws std::bad_alloc.
  void refused(const LogCaller& caller, const char* entitlement, const std::function<std::string()>& why);

  // Logs the counts that were not logged yet, and forgets every caller.
  void flush() noexcept;

 private:
  // No initialisers and no allocations: an unused entry costs nothing, and a lack of memory changes nothing.
  struct Account {
    uid_t uid;
    std::array<char, 256> executable;  // the beginning of its path, with a NUL
    std::chrono::nanoseconds told;
    std::uint64_t untold;
  };
  struct Others {
    std::chrono::nanoseconds told{};
    std::uint64_t untold = 0;
  };
  // Counts the refusal; true if it must be logged.
  bool count(const LogCaller& caller);
  Account* find(const LogCaller& caller) noexcept;
  void dropThoseOfLongAgo(std::chrono::nanoseconds now) noexcept;
  static void tell(const Account& account) noexcept;
  static void tellOfOthers(std::uint64_t untold) noexcept;

  const Clock now_;
  std::mutex mutex_;
  std::optional<Others> others_;
  std::size_t count_ = 0;
  std::array<Account, kMaxCallers> callers_;  // last: its pages stay untouched until a caller is refused
};

}  // namespace brenvik
