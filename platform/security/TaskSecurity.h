// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "platform/ipc/AuditToken.h"
#include "platform/plist/PropertyList.h"

namespace brenvik {

// One caller. A task object lives for one question, refers to exactly one process, and belongs to one thread.
class SecurityTask {
 public:
  struct Answer {
    PropertyList value;  // none if the caller does not hold the entitlement
    bool error = false;  // the question could not be answered; do not trust the value
  };

  virtual ~SecurityTask() = default;
  virtual Answer copyEntitlement(std::string_view name) noexcept = 0;

  // For people: explains in half a sentence why copyEntitlement has no value true for this name. Costs more
  // than the question. Empty if memory runs out.
  virtual std::string explainRefusal(std::string_view name) noexcept = 0;
  // For people: the path of the caller's executable, and the unit of the service manager that it runs in;
  // each is empty if unknown. Throws std::bad_alloc.
  struct Caller {
    std::string executable;
    std::string unit;
  };
  virtual Caller describeCaller() const = 0;
};

// The platform's task-security service: tells which entitlements the sender of a message holds.
class TaskSecurity {
 public:
  virtual ~TaskSecurity() = default;
  // Returns null if the token's process has exited, if another process has its id, or if it cannot hold any
  // entitlement.
  virtual std::unique_ptr<SecurityTask> makeTask(const AuditToken& caller) noexcept = 0;
  // For people: explains in half a sentence why makeTask returned null. Empty if memory runs out.
  virtual std::string explainNoTask(const AuditToken& caller) noexcept = 0;
};

}  // namespace brenvik
