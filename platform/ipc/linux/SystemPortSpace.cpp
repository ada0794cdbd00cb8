// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/SystemPortSpace.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <new>

#include "platform/datagram/LocalSocket.h"

namespace brenvik {
namespace {

// Whether nothing can be put into the socket any more: its other end is gone, or either end has been shut.
bool canReceiveNothingMore(int socket) noexcept {
  pollfd state{socket, POLLRDHUP, 0};
  return ::poll(&state, 1, 0) == 1 && (state.revents & (POLLHUP | POLLRDHUP)) != 0;
}

// Without a line it is closed here: the process ends, or this is the line's own thread.
void closeIn(const std::weak_ptr<ClosingLine>& line, UniqueFd descriptor, ClosingLine::Account account) {
  if (const auto alive = line.lock()) alive->close(std::move(descriptor), account);
}

}  // namespace

SystemPortSpace::SharedFd SystemPortSpace::share(UniqueFd socket, Account account) {
  return SharedFd(new UniqueFd(std::move(socket)), [line = weakLine(), account](const UniqueFd* given) {
    const std::unique_ptr<UniqueFd> owned(const_cast<UniqueFd*>(given));
    // Nobody else holds it, so nothing is put into it once it is shut, and most are empty then.
    (void)::shutdown(owned->get(), SHUT_RDWR);
    if (!isDrained(owned->get())) closeIn(line, std::move(*owned), account);
  });
}

SystemPortSpace::SharedFd SystemPortSpace::shareForeign(UniqueFd socket, Account account) {
  return SharedFd(new UniqueFd(std::move(socket)), [line = weakLine(), account](const UniqueFd* given) {
    const std::unique_ptr<UniqueFd> owned(const_cast<UniqueFd*>(given));
    // Others may still use the same socket, so it is not shut. In most cases the other end is gone.
    if (!canReceiveNothingMore(owned->get()) || !isDrained(owned->get())) {
      closeIn(line, std::move(*owned), account);
    }
  });
}

// Names count up and wrap after four thousand million: a freed name is not met again soon.
PortName SystemPortSpace::unusedName() noexcept {
  do {
    ++last_;
  } while (!isUsablePort(last_) || ports_.count(last_) != 0);
  return last_;
}

SystemPortSpace::Port& SystemPortSpace::insert(PortName* name) {
  const PortName fresh = unusedName();
  Port& port = ports_[fresh];
  *name = fresh;
  return port;
}

void SystemPortSpace::eraseIfUnused(PortName name) noexcept {
  const auto found = ports_.find(name);
  if (found == ports_.end()) return;
  if (found->second.receiveReferences == 0 && found->second.sendReferences == 0) ports_.erase(found);
}

KernelReturn SystemPortSpace::allocateReceiveRight(PortName* name) noexcept {
  *name = kNullPort;
  UniqueFd receive;
  UniqueFd peer;
  if (makeSocketPair(&receive, &peer) != 0) return kern::resourceShortage;
  try {
    auto shared = share(std::move(receive), ClosingLine::kClients);
    Port& port = insert(name);
    port.receive = std::move(shared);
    port.receiveReferences = 1;
    port.peer = std::move(peer);
    return kern::success;
  } catch (const std::bad_alloc&) {
    return kern::resourceShortage;
  }
}

KernelReturn SystemPortSpace::insertSendRight(PortName name) noexcept {
  const auto found = ports_.find(name);
  if (found == ports_.end()) return kern::invalidName;
  Port& port = found->second;
  if (port.receiveReferences == 0 || port.service) return kern::invalidRight;
  if (port.send == nullptr) {
    if (!port.peer.isValid()) return kern::invalidRight;  // it has left
    try {
      // Its messages are our own, and its holder uses the same socket: an ordinary close.
      port.send = std::make_shared<const UniqueFd>(std::move(port.peer));
    } catch (const std::bad_alloc&) {
      return kern::resourceShortage;
    }
  }
  ++port.sendReferences;
  return kern::success;
}

KernelReturn SystemPortSpace::dropReceiveRight(PortName name) noexcept {
  const auto found = ports_.find(name);
  if (found == ports_.end()) return kern::invalidName;
  Port& port = found->second;
  if (port.receiveReferences == 0) return kern::invalidRight;
  if (--port.receiveReferences == 0) {
    if (!port.socketFile.empty()) {
      // Another instance may have put its own socket there since: only ours is removed.
      struct stat status {};
      if (::lstat(port.socketFile.c_str(), &status) == 0 && status.st_ino == port.socketInode) {
        ::unlink(port.socketFile.c_str());
      }
    }
    port.receive.reset();
    port.peer.reset();
  }
  eraseIfUnused(name);
  return kern::success;
}

KernelReturn SystemPortSpace::deallocateSendRight(PortName name) noexcept {
  const auto found = ports_.find(name);
  if (found == ports_.end()) return kern::invalidName;
  Port& port = found->second;
  if (port.sendReferences == 0) return kern::invalidRight;
  if (--port.sendReferences == 0) port.send.reset();
  eraseIfUnused(name);
  return kern::success;
}

PortName SystemPortSpace::adoptService(UniqueFd listening, std::string socketFile) noexcept {
  try {
    // Closing it drops what was sent over connections that nobody has accepted.
    auto shared = shareForeign(std::move(listening), ClosingLine::kClients);
    PortName name = kNullPort;
    Port& port = insert(&name);
    port.receive = std::move(shared);
    port.receiveReferences = 1;
    port.service = true;
    struct stat status {};
    if (!socketFile.empty() && ::lstat(socketFile.c_str(), &status) == 0) port.socketInode = status.st_ino;
    port.socketFile = std::move(socketFile);
    return name;
  } catch (const std::bad_alloc&) {
    return kNullPort;
  }
}

PortName SystemPortSpace::adoptSendRight(UniqueFd end, Account account) noexcept {
  try {
    auto shared = shareForeign(std::move(end), account);
    PortName name = kNullPort;
    Port& port = insert(&name);
    port.send = std::move(shared);
    port.sendReferences = 1;
    return name;
  } catch (const std::bad_alloc&) {
    return kNullPort;
  }
}

void SystemPortSpace::sendRightHasLeft(PortName name) noexcept {
  const auto found = ports_.find(name);
  if (found != ports_.end() && found->second.receiveReferences > 0) found->second.send.reset();
}

SystemPortSpace::SharedFd SystemPortSpace::receiveEnd(PortName name) const noexcept {
  const auto found = ports_.find(name);
  return found == ports_.end() ? nullptr : found->second.receive;
}

SystemPortSpace::SharedFd SystemPortSpace::sendEnd(PortName name) const noexcept {
  const auto found = ports_.find(name);
  return found == ports_.end() ? nullptr : found->second.send;
}

bool SystemPortSpace::isService(PortName name) const noexcept {
  const auto found = ports_.find(name);
  return found != ports_.end() && found->second.service;
}

}  // namespace brenvik
