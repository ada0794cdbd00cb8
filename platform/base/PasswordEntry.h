// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

namespace brenvik {

// What the password database says of an account: getpwnam_r(3), nsswitch.conf(5).
struct PasswordEntry {
  uid_t uid = 0;
  gid_t gid = 0;
  std::string home;  // empty: the account has none
};

// Look an account up. Return 0, or the error of the look-up: ENOMEM, EMFILE or ENFILE when this process lacks
// memory or descriptors, another value is the database's own. *entry has a value only if the account was
// found; 0 and no value means that there is no such account. Any thread; a call may wait for the service that
// the system keeps its accounts in. Both throw std::bad_alloc.
int readPasswordEntry(const char* name, std::optional<PasswordEntry>* entry);
int readPasswordEntry(uid_t uid, std::optional<PasswordEntry>* entry);

}  // namespace brenvik
