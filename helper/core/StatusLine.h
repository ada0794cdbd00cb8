// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <string>

#include "platform/runloop/WorkQueue.h"
#include "platform/servicemanager/ServiceManager.h"

namespace brenvik {

// Keeps the line that the service manager shows up to date: a second after a change, with whatever else has
// changed by then, so at most once a second, and never while a reply is awaited. Without a service manager
// that listens it does nothing. Made and destroyed on the main loop.
class StatusLine {
 public:
  // `line` makes the text, on the main loop; it may throw std::bad_alloc. What is given outlives this object.
  StatusLine(WorkQueues& queues, ServiceManager& manager, std::function<std::string()> line);

  // Any thread.
  void changed() noexcept;

 private:
  void show();

  WorkQueues& queues_;
  ServiceManager& manager_;
  const std::function<std::string()> line_;
  std::string shown_;                        // main loop only
  std::atomic<bool> isUnderWay_{false};      // somebody will look
  const std::shared_ptr<StatusLine*> self_;  // tasks hold it weakly
};

}  // namespace brenvik
