// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <utility>

#include "platform/stores/StoreFolder.h"

namespace brenvik {

// The folder <home>/Library/<name>. No link below the home is followed; links on the path to the home are
// followed only if nobody but root can have put them there.
class PreparedFolder final : public StoreFolder {
 public:
  struct Account {
    std::string home;  // empty: the account has none
    uid_t uid;
    gid_t gid;
  };

  // `account` is called for each operation, so nothing is looked up before the first; it may throw
  // std::bad_alloc. `file` is the database's name in the folder.
  PreparedFolder(std::function<Account()> account, std::string name, std::string file)
      : account_(std::move(account)), name_(std::move(name)), file_(std::move(file)) {}

  // Makes missing folders for the account, "Library" with mode 0755 and the store's with 0700. They appear
  // complete or not at all, and are on the disk when this returns.
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
