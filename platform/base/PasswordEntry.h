// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

namespace brenvik {

// An account as the password database has it: getpwnam_r(3), nsswitch.conf(5).
struct PasswordEntry {
  uid_t uid = 0;
  gid_t gid = 0;
  std::string home;  // empty: the account has none
};

// Look up an account, and return 0 or an errno. ENOMEM, EMFILE and ENFILE mean that this process lacks memory
// or descriptors; any other value comes from the database. *entry has a value only if the account was found;
// 0 and no value means that there is no such account. Any thread; a call may block on the service that keeps
// the accounts. Both throw std::bad_alloc.
int readPasswordEntry(const char* name, std::optional<PasswordEntry>* entry);
int readPasswordEntry(uid_t uid, std::optional<PasswordEntry>* entry);

}  // namespace brenvik
