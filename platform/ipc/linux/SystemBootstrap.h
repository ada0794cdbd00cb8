// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

#include "platform/ipc/linux/SystemPortSpace.h"

namespace brenvik {

// Named services as socket files in one directory. If the service manager already listens for a service
// (sd_listen_fds(3), a descriptor named after the service), its socket is used and the file stays the
// manager's. Otherwise this class makes the directory (mode 0755) and the socket (mode 0660, owned by root
// and the group). It replaces a stale socket file and fails if somebody listens there. If the process that
// listened has ended, it waits up to a second for others that still hold its socket. Main thread only.
class SystemBootstrap final : public Bootstrap {
 public:
  // `group`: the group that may connect; root's group if there is no group of that name. Only root can set
  // it.
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
