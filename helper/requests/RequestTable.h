// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "helper/requests/ServerRoutines.h"
#include "platform/ipc/RoutineTable.h"

namespace brenvik {

// The table of 27 request routines that is served on every client's port: checks a request's form against
// its row in interface/Routines.h, calls the server routine and builds the reply.
class RequestTable final : public RoutineTable {
 public:
  // The routines outlive the table.
  explicit RequestTable(ServerRoutines& routines) noexcept : routines_(routines) {}

  Handler find(std::int32_t id) const noexcept override;
  void* context() const noexcept override { return &routines_; }

 private:
  ServerRoutines& routines_;
};

}  // namespace brenvik
