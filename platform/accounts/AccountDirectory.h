// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

namespace brenvik {

struct AccountIds {
  uid_t uid = 0;
  gid_t gid = 0;
  bool operator==(const AccountIds&) const = default;
};

// The accounts the system knows. Any thread; a call may wait for the service that keeps the accounts.
// Throws std::bad_alloc when this process lacks the memory or the descriptors to find out: that is no answer.
class AccountDirectory {
 public:
  virtual ~AccountDirectory() = default;
  // Nothing when there is no such account, or it could not be looked up.
  virtual std::optional<AccountIds> idsOf(const char* name) = 0;
  // The path of the account's home directory, as the system reports it, whether it exists or not. Nothing
  // when there is no such account or it has none.
  virtual std::optional<std::string> homeDirectoryOf(const char* name) = 0;
};

}  // namespace brenvik
