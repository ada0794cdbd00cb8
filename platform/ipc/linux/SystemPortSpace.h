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
// A descriptor that others made, or that holds messages nobody has read, is closed by a thread of its own.
class SystemPortSpace final : public PortSpace {
 public:
  using SharedFd = ClosingLine::SharedFd;
  using Account = ClosingLine::Account;

  KernelReturn allocateReceiveRight(PortName* name) noexcept override;
  KernelReturn insertSendRight(PortName name) noexcept override;
  KernelReturn dropReceiveRight(PortName name) noexcept override;
  KernelReturn deallocateSendRight(PortName name) noexcept override;

  // Takes over a listening socket as the receive right of a service. `socketFile`: removed with the right, if
  // it is still this socket's; empty: left alone. Null name when memory ran out.
  PortName adoptService(UniqueFd listening, std::string socketFile) noexcept;
  // Takes over a send right that arrived in a message of the account. Null name when memory ran out.
  PortName adoptSendRight(UniqueFd end, Account account = ClosingLine::kClients) noexcept;
  // A copy of the port's only send right is on its way to its holder: the descriptor goes with the last copy
  // of `sendEnd` that was taken, the name and its references stay. From then on the port hangs up with its
  // holder.
  void sendRightHasLeft(PortName name) noexcept;

  // Shares a connected socket that only this process holds. Throws bad_alloc.
  SharedFd share(UniqueFd socket, Account account);
  // Shares a socket that others may hold, too, or that others can put messages into. Throws bad_alloc.
  SharedFd shareForeign(UniqueFd socket, Account account);
  ClosingLine& closing() noexcept { return *closing_; }

  // The descriptor behind a right, kept open by the result even when the name is freed meanwhile; null when
  // there is no such right.
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
  // A new port, and its name. Throws std::bad_alloc; then *name stays as it is.
  Port& insert(PortName* name);
  std::weak_ptr<ClosingLine> weakLine() const noexcept { return closing_; }
  void eraseIfUnused(PortName name) noexcept;

  // Jobs hold descriptors of ours and may outlive this object.
  const std::shared_ptr<ClosingLine> closing_ = std::make_shared<ClosingLine>();
  std::unordered_map<PortName, Port> ports_;
  PortName last_ = 0x100;
};

}  // namespace brenvik
