// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

#include "platform/ipc/linux/SystemPortSpace.h"

namespace brenvik {

// Named services as socket files in one directory. A service that the service manager already listens for
// (sd_listen_fds(3), a descriptor named after the service) is taken over, and its file is the manager's; else
// the directory (mode 0755) and the socket (mode 0660, root's and the group's) are made here, a stale file is
// replaced, and a file behind which somebody listens is refused. Main thread only.
class SystemBootstrap final : public Bootstrap {
 public:
  // `group`: who may connect; root's group where there is none of that name, and unless root makes the
  // socket.
  SystemBootstrap(SystemPortSpace& ports, std::string directory, std::string group)
      : ports_(ports), directory_(std::move(directory)), group_(std::move(group)) {}

  KernelReturn checkIn(const char* serviceName, PortName* receiveRight) noexcept override;

 private:
  UniqueFd listenAt(const std::string& path, const char* serviceName);
  bool openToGroup(const std::string& path) const;

  SystemPortSpace& ports_;
  const std::string directory_;
  const std::string group_;
};

}  // namespace brenvik
