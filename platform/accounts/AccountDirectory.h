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

// The accounts the system knows. Any thread; a call may block on the service that keeps the accounts.
// Throws std::bad_alloc when this process lacks the memory or the descriptors to find out.
class AccountDirectory {
 public:
  virtual ~AccountDirectory() = default;
  // Returns nothing if there is no such account, or if it could not be looked up.
  virtual std::optional<AccountIds> idsOf(const char* name) = 0;
  // Returns the path of the account's home directory as the system reports it; the directory may not exist.
  // Returns nothing if there is no such account, or if it has no home directory.
  virtual std::optional<std::string> homeDirectoryOf(const char* name) = 0;
};

}  // namespace brenvik
