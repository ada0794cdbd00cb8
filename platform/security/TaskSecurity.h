// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <optional>
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
};

// The platform's task-security service: which entitlements has the process that sent a message?
class TaskSecurity {
 public:
  virtual ~TaskSecurity() = default;
  // Null when the process of the token is gone or is another one by now.
  virtual std::unique_ptr<SecurityTask> makeTask(const AuditToken& caller) noexcept = 0;
};

}  // namespace brenvik
