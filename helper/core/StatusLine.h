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

// Keeps the status line that the service manager shows up to date. It sends the line one second after a
// change, so at most once a second, and never while a client waits for a reply. If no service manager
// listens, it does nothing. Construct and destroy it on the main loop.
class StatusLine {
 public:
  // `line` makes the text, on the main loop; it may throw std::bad_alloc. The arguments must outlive this
  // object.
  StatusLine(WorkQueues& queues, ServiceManager& manager, std::function<std::string()> line);

  // Call it after a change. Any thread.
  void changed() noexcept;

 private:
  void show();

  WorkQueues& queues_;
  ServiceManager& manager_;
  const std::function<std::string()> line_;
  std::string shown_;                        // main loop only
  std::atomic<bool> isUnderWay_{false};      // an update is already scheduled
  const std::shared_ptr<StatusLine*> self_;  // tasks hold it weakly
};

}  // namespace brenvik
