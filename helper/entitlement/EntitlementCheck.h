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

// Whether a caller holds a boolean entitlement. The security service is asked once a process: what it grants
// is remembered until that process exits. What it does not grant is not remembered. Any thread.
class EntitlementCheck {
 public:
  // Both must outlive the last call of HasEntitlement. Processes are watched through `queues`; after this
  // object is gone their exits are of no interest. `now` counts on, from any beginning: refusals are told at
  // times.
  EntitlementCheck(TaskSecurity& security, WorkQueues& queues, RefusalLog::Clock now = steadyTime);
  EntitlementCheck(const EntitlementCheck&) = delete;
  EntitlementCheck& operator=(const EntitlementCheck&) = delete;
  ~EntitlementCheck();  // as tearDown

  // True when the caller holds it with the value true. False, too, when there is no such caller, when the
  // service could not answer, or when the value is no boolean; the log then says why, see RefusalLog.h.
  bool HasEntitlement(std::string_view name, const AuditToken& caller) noexcept;

  // Who a caller is that was granted something, for the lines that its requests cause; null when not known.
  std::shared_ptr<const LogCaller> describe(const AuditToken& caller) const noexcept;

  // Stops watching and forgets every grant, for good: from then on each question goes to the service.
  void tearDown() noexcept;

  // How many grants are remembered, and how many processes are watched.
  std::size_t grants() const noexcept;
  std::size_t watchers() const noexcept;

 private:
  struct State;
  static std::chrono::nanoseconds steadyTime();
  void remember(std::string_view name, const AuditToken& caller, std::shared_ptr<const LogCaller> described);

  TaskSecurity& security_;
  WorkQueues& queues_;
  const std::shared_ptr<State> state_;  // an exit handler that is late finds it, or finds it gone
  RefusalLog refusals_;
};

}  // namespace brenvik
