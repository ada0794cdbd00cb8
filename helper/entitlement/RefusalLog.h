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

// Tells of refused callers in the log, and lets nobody fill it. A caller, here an account with an executable,
// gets a line for its first refusal, and then one a minute at most, with the number of those that had none.
// Beyond so many callers at a time, all further ones count as one. Any thread.
class RefusalLog {
 public:
  using Clock = std::function<std::chrono::nanoseconds()>;

  static constexpr std::chrono::minutes kInterval{1};
  static constexpr std::size_t kMaxCallers = 64;

  explicit RefusalLog(Clock now) : now_(std::move(now)) {}

  // A caller was refused. `why` is asked only when a line is written. Throws std::bad_alloc.
  void refused(const LogCaller& caller, const char* entitlement, const std::function<std::string()>& why);

  // Writes the numbers that are still to be told, and forgets every caller.
  void flush() noexcept;

 private:
  // Without initialisers and without allocations: what is never used costs nothing, and a lack of memory
  // leaves no traces.
  struct Account {
    uid_t uid;
    std::array<char, 256> executable;  // its beginning, with a NUL
    std::chrono::nanoseconds told;
    std::uint64_t untold;
  };
  struct Others {
    std::chrono::nanoseconds told{};
    std::uint64_t untold = 0;
  };
  // Counts the refusal, and says whether it is to be written.
  bool count(const LogCaller& caller);
  Account* find(const LogCaller& caller) noexcept;
  void dropThoseOfLongAgo(std::chrono::nanoseconds now) noexcept;
  static void tell(const Account& account) noexcept;
  static void tellOfOthers(std::uint64_t untold) noexcept;

  const Clock now_;
  std::mutex mutex_;
  std::optional<Others> others_;
  std::size_t count_ = 0;
  std::array<Account, kMaxCallers> callers_;  // last: pages that nobody touches until somebody is refused
};

}  // namespace brenvik
