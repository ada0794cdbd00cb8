// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/socket.h>
#include <sys/un.h>

#include "platform/servicemanager/ServiceManager.h"

namespace brenvik {

// The datagram socket that the service manager names in NOTIFY_SOCKET (sd_notify(3)): a path, or "@" and an
// abstract name.
class NotifySocket final : public ServiceManager {
 public:
  static constexpr const char* kVariable = "NOTIFY_SOCKET";

  // Takes the variable out of the environment. Before other threads start.
  NotifySocket() noexcept;

  bool listens() const noexcept override { return size_ != 0; }
  void show(const std::string& line) override;

 private:
  sockaddr_un address_{};
  socklen_t size_ = 0;
};

}  // namespace brenvik
