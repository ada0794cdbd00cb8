// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <functional>
#include <utility>

#include "helper/requests/RoutineHandlers.h"

namespace brenvik {

// The table of 27 request routines that is served on every client's port. A handler checks a request's form
// against its row in interface/Routines.h, calls the routine of its area and builds the reply.
//
// The areas are made at the first request, because the client that started the process is waiting for its
// check-in, which needs none of them. Main loop only.
template <class Areas = RequestAreas>
class RequestTable final : public RoutineTable {
 public:
  // `make` returns the areas, which must outlive the table, or throws std::bad_alloc. Then the request gets
  // kern::resourceShortage, and the next one calls `make` again.
  explicit RequestTable(std::function<Areas*()> make) : make_(std::move(make)) {}

  Handler find(std::int32_t id) const noexcept override {
    try {
      if (areas_ == nullptr) areas_ = make_();
    } catch (...) {
      return [](void*, const Request&, Reply& reply) {
        reply.setStatus(kern::resourceShortage);
        return Outcome::refused;
      };
    }
    const auto index = static_cast<std::uint32_t>(id) - static_cast<std::uint32_t>(kFirstRequestId);
    return index < kRowHandlers<Areas>.size() ? kRowHandlers<Areas>[index] : nullptr;
  }
  void* context() const noexcept override { return areas_; }

 private:
  const std::function<Areas*()> make_;
  mutable Areas* areas_ = nullptr;
};

}  // namespace brenvik
