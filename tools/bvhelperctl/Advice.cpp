// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/Advice.h"

#include <pwd.h>
#include <unistd.h>

#include "tools/support/PropertyListText.h"

namespace brenvik::tools {

std::string accountOfThisProcess() {
  const passwd* account = ::getpwuid(::geteuid());
  return account == nullptr ? "user " + std::to_string(::geteuid()) : printable(account->pw_name);
}

std::string groupAdvice() {
  return "Only root and members of the group \"" BRENVIK_SERVICE_GROUP
         "\" may. Let an administrator add the account, and log in anew:\n"
         "  usermod -aG " BRENVIK_SERVICE_GROUP " " +
         accountOfThisProcess();
}

}  // namespace brenvik::tools
