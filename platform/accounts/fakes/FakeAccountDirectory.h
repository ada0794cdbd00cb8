// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <functional>
#include <map>
#include <new>
#include <string>

#include "platform/accounts/AccountDirectory.h"

namespace brenvik {

// The accounts a test says there are. Set it up before other threads ask.
class FakeAccountDirectory final : public AccountDirectory {
 public:
  struct Account {
    std::optional<AccountIds> ids;
    std::optional<std::string> home;
  };

  std::optional<AccountIds> idsOf(const char* name) override {
    ++idLookUps;
    if (exhausted) throw std::bad_alloc();
    if (whenAskedForIds) whenAskedForIds(name);
    const auto it = accounts.find(name);
    return it == accounts.end() ? std::nullopt : it->second.ids;
  }
  std::optional<std::string> homeDirectoryOf(const char* name) override {
    ++homeLookUps;
    if (exhausted) throw std::bad_alloc();
    const auto it = accounts.find(name);
    return it == accounts.end() ? std::nullopt : it->second.home;
  }

  std::map<std::string, Account> accounts;
  bool exhausted = false;                                        // there is no memory
  std::function<void(const std::string& name)> whenAskedForIds;  // runs before the answer is given
  std::atomic<int> idLookUps{0};
  std::atomic<int> homeLookUps{0};
};

}  // namespace brenvik
