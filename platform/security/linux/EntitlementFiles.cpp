// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/EntitlementFiles.h"

#include <optional>
#include <utility>

#include "platform/security/linux/CallerProcess.h"

namespace brenvik {

class EntitlementFiles::Task final : public SecurityTask, private EntitlementCandidate {
 public:
  // `facts` is what the process was when the task was made.
  Task(EntitlementSearch& search, CallerProcess process, CallerFacts facts, uid_t uid) noexcept
      : search_(search), process_(std::move(process)), facts_(std::move(facts)), uid_(uid) {}

  Answer copyEntitlement(std::string_view name) noexcept override try {
    EntitlementSearch::Result result = search_.find(name, *this);
    // Last, so that whatever was read was read while the caller was there: a process that has gone holds
    // nothing, and one that has become another program holds what that one does.
    if (result.value && process_.executable() != facts_.executable) return {};
    return {std::move(result.value), result.error};
  } catch (...) {
    return {{}, true};  // out of memory
  }

  std::string explainRefusal(std::string_view name) noexcept override try {
    std::vector<EntitlementFinding> findings;
    const EntitlementSearch::Result result = search_.find(name, *this, &findings);
    // Whatever the files said, it was not of this program.
    if (const auto now = process_.executable(); !now || now != facts_.executable) {
      return "the caller has ended, or has become another program";
    }
    return whyNotEntitled(result, findings);
  } catch (...) {
    return {};  // out of memory
  }

  Caller describeCaller() const override { return {facts_.executablePath, process_.unit()}; }

 private:
  uid_t uid() const noexcept override { return uid_; }
  const std::optional<FileIdentity>& executable() override { return facts_.executable; }
  const std::string& unit() override {
    if (!unit_) unit_ = process_.unit();
    return *unit_;
  }

  EntitlementSearch& search_;
  const CallerProcess process_;
  const CallerFacts facts_;
  const uid_t uid_;
  std::optional<std::string> unit_;  // asked for once
};

EntitlementFiles::EntitlementFiles(AccountDirectory& accounts, CallerReader* reader)
    : EntitlementFiles(accounts, entitlementDirectories(), "/proc", reader) {}

EntitlementFiles::EntitlementFiles(AccountDirectory& accounts, std::vector<std::string> directories,
                                   std::string proc, CallerReader* reader)
    : search_(accounts, std::move(directories)), proc_(std::move(proc)), reader_(reader) {}

std::unique_ptr<SecurityTask> EntitlementFiles::makeTask(const AuditToken& caller) noexcept try {
  auto process = CallerProcess::pin(proc_, caller.pid(), caller.pidVersion(), reader_);
  if (!process) return nullptr;
  CallerFacts facts = process->facts();
  if (!isInOurNamespace(facts)) return nullptr;
  return std::make_unique<Task>(search_, std::move(*process), std::move(facts), caller.uid());
} catch (...) {
  return nullptr;  // out of memory
}

std::string EntitlementFiles::explainNoTask(const AuditToken& caller) noexcept try {
  const auto process = CallerProcess::pin(proc_, caller.pid(), caller.pidVersion(), reader_);
  if (!process) return "the caller has ended";
  const CallerFacts facts = process->facts();
  if (!facts.userNamespace) return "the caller's user namespace cannot be told";
  return isInOurNamespace(facts) ? "the caller cannot be examined now"
                                 : "the caller is in a user namespace of its own";
} catch (...) {
  return {};  // out of memory
}

// Whoever makes a user namespace is root in it, of mounts among others.
bool EntitlementFiles::isInOurNamespace(const CallerFacts& caller) const {
  return caller.userNamespace && caller.userNamespace == CallerProcess::namespaceOfThisProcess(proc_);
}

}  // namespace brenvik
