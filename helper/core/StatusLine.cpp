// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/core/StatusLine.h"

#include <chrono>
#include <new>
#include <utility>

namespace brenvik {
namespace {

constexpr std::chrono::seconds kPause{1};

}  // namespace

StatusLine::StatusLine(WorkQueues& queues, ServiceManager& manager, std::function<std::string()> line)
    : queues_(queues),
      manager_(manager),
      line_(std::move(line)),
      self_(std::make_shared<StatusLine*>(this)) {}

void StatusLine::changed() noexcept {
  if (!manager_.listens() || isUnderWay_.exchange(true)) return;
  try {
    // Two steps: the first comes after the reply to whoever made the change, for a timer takes system calls.
    queues_.main().post([weak = std::weak_ptr(self_)] {
      const auto self = weak.lock();
      if (self == nullptr) return;
      try {
        (*self)->queues_.main().postAfter(kPause, [weak] {
          if (const auto alive = weak.lock()) (*alive)->show();
        });
      } catch (const std::bad_alloc&) {
        (*self)->isUnderWay_ = false;
        throw;
      }
    });
  } catch (const std::bad_alloc&) {
    isUnderWay_ = false;  // the next change tries again
  }
}

void StatusLine::show() {
  isUnderWay_ = false;  // first: what changes from here on is told next time
  std::string line = line_();
  if (line == shown_) return;
  manager_.show(line);
  shown_ = std::move(line);
}

}  // namespace brenvik
