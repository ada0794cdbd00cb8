// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/entitlement/RefusalLog.h"

#include "platform/log/Log.h"

namespace brenvik {
namespace {

const char* orElse(const std::string& text, const char* otherwise) noexcept {
  return text.empty() ? otherwise : text.c_str();
}

}  // namespace

void RefusalLog::refused(const LogCaller& caller, const char* entitlement,
                         const std::function<std::string()>& why) {
  const auto untold = count(caller);
  if (!untold) return;
  if (untold->count > 0) {
    untold->isOfOthers ? tellOfOthers(untold->count) : tell({caller.uid, caller.executable}, untold->count);
  }
  // A caller chooses its path, and must not push the reason out of the line; the field has all of it.
  logUnified(LogLevel::standard,
             "refused process %d: account %u, executable %.256s, unit %.256s: it does not hold %s: %s",
             static_cast<int>(caller.pid), caller.uid, orElse(caller.executable, "not known"),
             orElse(caller.unit, "none"), entitlement, orElse(why(), "not known"));
}

std::optional<RefusalLog::Untold> RefusalLog::count(const LogCaller& caller) {
  const std::lock_guard lock(mutex_);
  const auto now = now_();
  const Key key{caller.uid, caller.executable};
  auto known = callers_.find(key);
  if (known == callers_.end() && callers_.size() >= kMostCallers) dropThoseWithNothingToTell(now);
  Account* account = nullptr;
  if (known != callers_.end()) {
    account = &known->second;
  } else if (callers_.size() < kMostCallers) {
    callers_.emplace(key, Account{now, 0});
    return Untold{};
  } else if (others_) {
    account = &*others_;
  } else {
    others_ = Account{now, 0};
    return Untold{};
  }
  if (now - account->told < kInterval) {
    ++account->untold;
    return std::nullopt;
  }
  account->told = now;
  return Untold{std::exchange(account->untold, 0), known == callers_.end()};
}

void RefusalLog::dropThoseWithNothingToTell(std::chrono::nanoseconds now) noexcept {
  for (auto it = callers_.begin(); it != callers_.end();) {
    if (now - it->second.told < kInterval) {
      ++it;
      continue;
    }
    if (it->second.untold > 0) tell(it->first, it->second.untold);
    it = callers_.erase(it);
  }
}

void RefusalLog::tell(const Key& who, std::uint64_t untold) noexcept {
  logUnified(LogLevel::standard, "refused %llu more check-ins of account %u, executable %.256s",
             static_cast<unsigned long long>(untold), who.first, orElse(who.second, "not known"));
}

void RefusalLog::tellOfOthers(std::uint64_t untold) noexcept {
  logUnified(LogLevel::standard, "refused %llu more check-ins of further callers",
             static_cast<unsigned long long>(untold));
}

void RefusalLog::flush() noexcept {
  const std::lock_guard lock(mutex_);
  for (const auto& [who, account] : callers_) {
    if (account.untold > 0) tell(who, account.untold);
  }
  if (others_ && others_->untold > 0) tellOfOthers(others_->untold);
  callers_.clear();
  others_.reset();
}

}  // namespace brenvik
