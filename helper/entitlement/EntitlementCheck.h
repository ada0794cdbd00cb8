// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <string_view>

#include "helper/entitlement/RefusalLog.h"
#include "platform/ipc/AuditToken.h"
#include "platform/log/LogContext.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/security/TaskSecurity.h"

namespace brenvik {

// Tells whether a caller holds a boolean entitlement. A grant of the security service is remembered until the
// caller's process exits; a refusal is not remembered. Any thread.
class EntitlementCheck {
 public:
  // The time since some moment, by a clock that is never set.
  static std::chrono::nanoseconds steadyTime();

  // `security` and `queues` must outlive the last call of HasEntitlement. `queues` watches the processes for
  // their exit; watching ends with this object. `now` is any clock that only moves forward; it limits how
  // often refusals are logged.
  EntitlementCheck(TaskSecurity& security, WorkQueues& queues, RefusalLog::Clock now = steadyTime);
  EntitlementCheck(const EntitlementCheck&) = delete;
  EntitlementCheck& operator=(const EntitlementCheck&) = delete;
  ~EntitlementCheck();  // does what tearDown does

  // True if the caller holds the entitlement with the value true. False also if there is no such caller, the
  // service could not answer, or the value is not a boolean; the log then has the reason, see RefusalLog.h.
  bool HasEntitlement(std::string_view name, const AuditToken& caller) noexcept;

  // Describes a caller that holds a grant, for the log lines that its requests cause; null if unknown.
  std::shared_ptr<const LogCaller> describe(const AuditToken& caller) const noexcept;

  // Stops watching and forgets every grant, for good. Later calls ask the service each time.
  void tearDown() noexcept;

  // The number of remembered grants, and of watched processes.
  std::size_t grants() const noexcept;
  std::size_t watchers() const noexcept;

 private:
  struct State;
  void remember(std::string_view name, const AuditToken& caller, std::shared_ptr<const LogCaller> described);

  TaskSecurity& security_;
  WorkQueues& queues_;
  const std::shared_ptr<State> state_;  // late exit handlers hold it weakly
  RefusalLog refusals_;
};

}  // namespace brenvik
