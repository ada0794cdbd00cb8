// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>
#include <vector>

#include "platform/accounts/AccountDirectory.h"
#include "platform/security/TaskSecurity.h"

namespace brenvik {

// Entitlements from property-list files that the administrator keeps (this folder's neighbour README.md says
// what stands in them). The files are read afresh for each question, in order, until one answers it; nothing
// is kept. What cannot be trusted is passed over with an error line; when a file might matter but cannot be
// read just now, the answer is an error. Any thread.
class EntitlementFiles final : public TaskSecurity {
 public:
  // The directories named at build time (BRENVIK_ENTITLEMENT_DIRECTORIES). `accounts` must outlive this
  // object and its tasks.
  explicit EntitlementFiles(AccountDirectory& accounts);
  // Earlier directories first. `proc` is where proc(5) is mounted.
  EntitlementFiles(AccountDirectory& accounts, std::vector<std::string> directories,
                   std::string proc = "/proc");

  std::unique_ptr<SecurityTask> makeTask(const AuditToken& caller) noexcept override;

 private:
  class Task;
  AccountDirectory& accounts_;
  const std::vector<std::string> directories_;
  const std::string proc_;
};

}  // namespace brenvik
