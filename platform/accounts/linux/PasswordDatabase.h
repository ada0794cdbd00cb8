// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "platform/accounts/AccountDirectory.h"

namespace brenvik {

// The password database, through the name service switch: getpwnam_r(3), nsswitch.conf(5).
class PasswordDatabase final : public AccountDirectory {
 public:
  std::optional<AccountIds> idsOf(const char* name) override;
  std::optional<std::string> homeDirectoryOf(const char* name) override;
};

}  // namespace brenvik
