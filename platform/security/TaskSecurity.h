// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "platform/ipc/AuditToken.h"
#include "platform/plist/PropertyList.h"

namespace brenvik {

// One caller, pinned: a task object lives for one question and belongs to one thread.
class SecurityTask {
 public:
  struct Answer {
    PropertyList value;  // none when the caller does not hold the entitlement
    bool error = false;  // the question could not be answered; the value, if any, is not to be trusted
  };

  virtual ~SecurityTask() = default;
  virtual Answer copyEntitlement(std::string_view name) noexcept = 0;

  // For people: why copyEntitlement has no value true for this name, in half a sentence. Costs more than the
  // question. Empty when memory is lacking.
  virtual std::string explainRefusal(std::string_view name) noexcept = 0;
  // For people: the path of what the caller executes, and the unit of the service manager that it runs in;
  // each empty when it is not known. Throws std::bad_alloc.
  struct Caller {
    std::string executable;
    std::string unit;
  };
  virtual Caller describeCaller() const = 0;
};

// The platform's task-security service: which entitlements has the process that sent a message?
class TaskSecurity {
 public:
  virtual ~TaskSecurity() = default;
  // Null when the process of the token is gone, is another one by now, or is one that can hold nothing.
  virtual std::unique_ptr<SecurityTask> makeTask(const AuditToken& caller) noexcept = 0;
  // For people: why makeTask made none, in half a sentence. Empty when memory is lacking.
  virtual std::string explainNoTask(const AuditToken& caller) noexcept = 0;
};

}  // namespace brenvik
