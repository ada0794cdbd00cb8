// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <unistd.h>

#include <string>
#include <utility>

#include "platform/datagram/LocalSocket.h"
#include "platform/ipc/Ports.h"
#include "platform/ipc/linux/SystemPortSpace.h"

namespace brenvik {

// Gives a service a real listening socket without a file: clients connect to `address`. Each check-in makes
// another address. Users link platform_ipc_linux as well.
class AbstractBootstrap final : public Bootstrap {
 public:
  explicit AbstractBootstrap(SystemPortSpace& ports) noexcept : ports_(ports) {}

  KernelReturn checkIn(const char*, PortName* receiveRight) noexcept override {
    address = {};
    address.sun_family = AF_UNIX;
    const std::string name = "brenvik-test-" + std::to_string(::getpid()) + "-" + std::to_string(++checkIns_);
    name.copy(address.sun_path + 1, sizeof address.sun_path - 2);
    UniqueFd socket = makeSocket(Blocking::no);
    if (bindSocket(socket.get(), address) != 0 || ::listen(socket.get(), 8) != 0 ||
        !askForCredentials(socket.get())) {
      return kern::failure;
    }
    *receiveRight = ports_.adoptService(std::move(socket), "");
    return kern::success;
  }

  sockaddr_un address{};

 private:
  SystemPortSpace& ports_;
  unsigned long checkIns_ = 0;
};

}  // namespace brenvik
