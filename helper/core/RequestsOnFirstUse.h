// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>
#include <memory>
#include <utility>

#include "platform/ipc/RoutineTable.h"

namespace brenvik {

// The table of requests, whose areas are made for the first of them: whoever started the process waits for
// its check-in, which needs none. While they cannot be made, requests get resourceShortage. `Areas` has
// requests() and shutDown(). Main thread only.
template <class Areas>
class RequestsOnFirstUse final : public RoutineTable {
 public:
  explicit RequestsOnFirstUse(std::function<std::unique_ptr<Areas>()> make) : make_(std::move(make)) {}

  Handler find(std::int32_t id) const noexcept override {
    try {
      if (areas_ == nullptr) areas_ = make_();
    } catch (...) {
      return [](void*, const Request&, Reply& reply) {
        reply.setStatus(kern::resourceShortage);
        return Outcome::refused;
      };
    }
    return areas_->requests().find(id);
  }
  void* context() const noexcept override {
    return areas_ != nullptr ? areas_->requests().context() : nullptr;
  }

  // Null before the first request.
  const Areas* areas() const noexcept { return areas_.get(); }

  // Ends the work of other threads, if there is any.
  void shutDown() noexcept {
    if (areas_ != nullptr) areas_->shutDown();
  }

 private:
  const std::function<std::unique_ptr<Areas>()> make_;
  mutable std::unique_ptr<Areas> areas_;
};

}  // namespace brenvik
