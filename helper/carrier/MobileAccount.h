// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <functional>

namespace brenvik {

// The facts about the "mobile" account that the carrier routines need.
struct MobileAccount {
  const char* home =
      nullptr;  // no trailing slash; lives as long as the process; null: the account has no home
  uid_t uid = 0;
  gid_t gid = 0;
};

// Called for each use, on the main thread only.
using MobileAccountSource = std::function<MobileAccount()>;

}  // namespace brenvik
