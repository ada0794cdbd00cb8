// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/entitlement/RefusalLog.h"

#include <algorithm>
#include <string_view>

#include "platform/log/Log.h"

namespace brenvik {
namespace {

constexpr std::size_t kKept = 255;  // of an executable's path

const char* orElse(const char* text, const char* otherwise) noexcept {
  return *text == '\0' ? otherwise : text;
}

}  // namespace

void RefusalLog::refused(const LogCaller& caller, const char* entitlement,
                         const std::function<std::string()>& why) {
  if (!count(caller)) return;
  // A caller chooses its path, and must not push the reason out of the line; the field has all of it.
  logUnified(LogLevel::standard,
             "refused process %d: account %u, executable %.256s, unit %.256s: it does not hold %s: %s",
             static_cast<int>(caller.pid), caller.uid, orElse(caller.executable.c_str(), "not known"),
             orElse(caller.unit.c_str(), "none"), entitlement, orElse(why().c_str(), "not known"));
}

bool RefusalLog::count(const LogCaller& caller) {
  const std::lock_guard lock(mutex_);
  const auto now = now_();
  if (Account* const known = find(caller)) {
    if (now - known->told < kInterval) {
      ++known->untold;
      return false;
    }
    if (known->untold > 0) tell(*known);
    known->told = now;
    known->untold = 0;
    return true;
  }
  if (count_ == callers_.size()) dropThoseOfLongAgo(now);
  if (count_ < callers_.size()) {
    Account& account = callers_[count_++];
    account.uid = caller.uid;
    account.executable[caller.executable.copy(account.executable.data(), kKept)] = '\0';
    account.told = now;
    account.untold = 0;
    return true;
  }
  if (others_ && now - others_->told < kInterval) {
    ++others_->untold;
    return false;
  }
  if (others_ && others_->untold > 0) tellOfOthers(others_->untold);
  others_ = Others{now, 0};
  return true;
}

RefusalLog::Account* RefusalLog::find(const LogCaller& caller) noexcept {
  const auto beginning = std::string_view(caller.executable).substr(0, kKept);
  const auto end = callers_.begin() + static_cast<std::ptrdiff_t>(count_);
  const auto found = std::find_if(callers_.begin(), end, [&](const Account& each) {
    return each.uid == caller.uid && each.executable.data() == beginning;
  });
  return found == end ? nullptr : &*found;
}

void RefusalLog::dropThoseOfLongAgo(std::chrono::nanoseconds now) noexcept {
  for (std::size_t i = 0; i < count_;) {
    Account& each = callers_[i];
    if (now - each.told < kInterval) {
      ++i;
      continue;
    }
    if (each.untold > 0) tell(each);
    each = callers_[--count_];
  }
}

void RefusalLog::tell(const Account& account) noexcept {
  logUnified(LogLevel::standard, "refused %llu more check-ins of account %u, executable %.256s",
             static_cast<unsigned long long>(account.untold), account.uid,
             orElse(account.executable.data(), "not known"));
}

void RefusalLog::tellOfOthers(std::uint64_t untold) noexcept {
  logUnified(LogLevel::standard, "refused %llu more check-ins of further callers",
             static_cast<unsigned long long>(untold));
}

void RefusalLog::flush() noexcept {
  const std::lock_guard lock(mutex_);
  for (std::size_t i = 0; i < count_; ++i) {
    if (callers_[i].untold > 0) tell(callers_[i]);
  }
  if (others_ && others_->untold > 0) tellOfOthers(others_->untold);
  count_ = 0;
  others_.reset();
}

}  // namespace brenvik
