// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <functional>

namespace brenvik {

// What the carrier routines need to know of the "mobile" account.
struct MobileAccount {
  const char* home =
      nullptr;  // no trailing slash, lives as long as the process; null: the account has no home
  uid_t uid = 0;
  gid_t gid = 0;
};

// Asked on each use; main thread only.
using MobileAccountSource = std::function<MobileAccount()>;

}  // namespace brenvik
