// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

#include "platform/ipc/linux/SystemPortSpace.h"

namespace brenvik {

// Named services as socket files in one directory. A service that the service manager already listens for
// (sd_listen_fds(3), a descriptor named after the service) is taken over, and its file is the manager's; else
// the directory and the socket (mode 0666) are made here, a stale file is replaced, and a file behind which
// somebody listens is refused. Main thread only.
class SystemBootstrap final : public Bootstrap {
 public:
  SystemBootstrap(SystemPortSpace& ports, std::string directory)
      : ports_(ports), directory_(std::move(directory)) {}

  KernelReturn checkIn(const char* serviceName, PortName* receiveRight) noexcept override;

 private:
  UniqueFd fromServiceManager(const char* serviceName);
  UniqueFd listenAt(const std::string& path, const char* serviceName) noexcept;

  SystemPortSpace& ports_;
  const std::string directory_;
};

}  // namespace brenvik
