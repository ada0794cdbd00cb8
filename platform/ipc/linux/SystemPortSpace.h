// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <string>
#include <unordered_map>

#include "platform/base/UniqueFd.h"
#include "platform/ipc/Ports.h"
#include "platform/ipc/linux/ClosingLine.h"

namespace brenvik {

// Ports on AF_UNIX SOCK_SEQPACKET sockets (unix(7)). A receive right is the end that is read: one end of a
// socket pair, or a listening socket for a service. A send right is the other end. Main loop only.
//
// Descriptors that came from other processes, or that hold unread messages, are closed on another thread.
class SystemPortSpace final : public PortSpace {
 public:
  using SharedFd = ClosingLine::SharedFd;
  using Account = ClosingLine::Account;

  KernelReturn allocateReceiveRight(PortName* name) noexcept override;
  KernelReturn insertSendRight(PortName name) noexcept override;
  KernelReturn dropReceiveRight(PortName name) noexcept override;
  KernelReturn deallocateSendRight(PortName name) noexcept override;

  // Takes over a listening socket as the receive right of a service. `socketFile` is removed with the right
  // if it still belongs to this socket; empty: no file is removed. Returns the null name if memory runs out.
  PortName adoptService(UniqueFd listening, std::string socketFile) noexcept;
  // Takes over a send right that arrived in a message of the account. Returns the null name if memory runs
  // out.
  PortName adoptSendRight(UniqueFd end, Account account = ClosingLine::kClients) noexcept;
  // Call it after a copy of the port's only send right was sent to its holder. The descriptor is closed with
  // the last copy of `sendEnd`; the name and its references stay. From then on, the port hangs up when its
  // holder does.
  void sendRightHasLeft(PortName name) noexcept;

  // Shares a connected socket that only this process holds. Throws std::bad_alloc.
  SharedFd share(UniqueFd socket, Account account);
  // Shares a socket that other processes may hold or send messages into. Throws std::bad_alloc.
  SharedFd shareForeign(UniqueFd socket, Account account);
  ClosingLine& closing() noexcept { return *closing_; }

  // Returns the descriptor behind a right, or null if there is no such right. The result keeps it open, even
  // if the name is freed meanwhile.
  SharedFd receiveEnd(PortName name) const noexcept;
  SharedFd sendEnd(PortName name) const noexcept;
  bool isService(PortName name) const noexcept;

  std::size_t size() const noexcept { return ports_.size(); }

 private:
  struct Port {
    SharedFd receive;  // with receiveReferences
    UniqueFd peer;     // what send rights are made from
    SharedFd send;     // with sendReferences
    unsigned receiveReferences = 0;
    unsigned sendReferences = 0;
    bool service = false;
    std::string socketFile;
    unsigned long long socketInode = 0;
  };

  PortName unusedName() noexcept;
  // Makes a port and its name. Throws std::bad_alloc, and then *name stays as it is.
  Port& insert(PortName* name);
  std::weak_ptr<ClosingLine> weakLine() const noexcept { return closing_; }
  void eraseIfUnused(PortName name) noexcept;

  // Jobs hold descriptors of this object and may outlive it.
  const std::shared_ptr<ClosingLine> closing_ = std::make_shared<ClosingLine>();
  std::unordered_map<PortName, Port> ports_;
  PortName last_ = 0x100;
};

}  // namespace brenvik
