// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <utility>

#include "platform/stores/StoreFolder.h"

namespace brenvik {

// <home>/Library/<name>. No link below the home is followed; those on the way to it only when nobody but root
// can have placed them.
class PreparedFolder final : public StoreFolder {
 public:
  struct Account {
    std::string home;  // empty: the account has none
    uid_t uid;
    gid_t gid;
  };

  // `account` is asked each time, so that nothing is looked up before the first; it may throw std::bad_alloc.
  // `file` is the database's name in the folder.
  PreparedFolder(std::function<Account()> account, std::string name, std::string file)
      : account_(std::move(account)), name_(std::move(name)), file_(std::move(file)) {}

  // Folders that are missing are made for the account, "Library" with mode 0755 and the store's with 0700;
  // they show whole or not at all, and are on the disk when they were made.
  State open(IfMissing ifMissing, Opened* folder) noexcept override;
  bool prepare(const Opened& folder) noexcept override;

 private:
  State walk(IfMissing ifMissing, Opened* folder);
  bool isGivenWhole(int folder, const Account& account) const;
  bool holdsOnlyAnOpenDatabase(int folder) const;
  bool giveAll(int folder, const Account& account) const;
  bool giveOpenDatabase(int folder, const Account& account) const;

  const std::function<Account()> account_;
  const std::string name_;
  const std::string file_;
};

}  // namespace brenvik
