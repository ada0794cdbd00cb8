// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>
#include <vector>

#include "platform/accounts/AccountDirectory.h"
#include "platform/security/TaskSecurity.h"
#include "platform/security/linux/CallerProcess.h"
#include "platform/security/linux/EntitlementSearch.h"

namespace brenvik {

// Entitlements from the administrator's property-list files, see EntitlementSearch.h. A caller that has
// exited, or is in another user namespace than this process, has no task. Any thread.
class EntitlementFiles final : public TaskSecurity {
 public:
  // Uses the directories named at build time (BRENVIK_ENTITLEMENT_DIRECTORIES). `accounts` must outlive this
  // object, which must outlive its tasks.
  explicit EntitlementFiles(AccountDirectory& accounts, CallerReader* reader = nullptr);
  // Earlier directories first. `proc` is where proc(5) is mounted. `reader` reads what this process may not
  // read by itself, and must outlive this object and its tasks; null: there is none.
  EntitlementFiles(AccountDirectory& accounts, std::vector<std::string> directories,
                   std::string proc = "/proc", CallerReader* reader = nullptr);

  std::unique_ptr<SecurityTask> makeTask(const AuditToken& caller) noexcept override;
  std::string explainNoTask(const AuditToken& caller) noexcept override;

 private:
  class Task;
  bool isInOurNamespace(const CallerFacts& caller) const;

  EntitlementSearch search_;
  const std::string proc_;
  CallerReader* const reader_;
};

}  // namespace brenvik
