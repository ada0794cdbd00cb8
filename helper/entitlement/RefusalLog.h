// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
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
  static constexpr std::size_t kMostCallers = 64;

  explicit RefusalLog(Clock now) : now_(std::move(now)) {}

  // A caller was refused. `why` is asked only when a line is written. Throws std::bad_alloc.
  void refused(const LogCaller& caller, const char* entitlement, const std::function<std::string()>& why);

  // Writes the numbers that are still to be told, and forgets every caller.
  void flush() noexcept;

 private:
  using Key = std::pair<uid_t, std::string>;
  struct Account {
    std::chrono::nanoseconds told{};
    std::uint64_t untold = 0;
  };
  struct Untold {
    std::uint64_t count = 0;
    bool isOfOthers = false;
  };
  // Counts the refusal. When it is to be written: how many were not since the last that was.
  std::optional<Untold> count(const LogCaller& caller);
  void dropThoseWithNothingToTell(std::chrono::nanoseconds now) noexcept;
  static void tell(const Key& who, std::uint64_t untold) noexcept;
  static void tellOfOthers(std::uint64_t untold) noexcept;

  const Clock now_;
  std::mutex mutex_;
  std::map<Key, Account> callers_;
  std::optional<Account> others_;
};

}  // namespace brenvik
