// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/HeldAddresses.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <cstddef>

namespace brenvik {
namespace {

constexpr socklen_t kPathOffset = offsetof(sockaddr_un, sun_path);

// The path, or the abstract address with its leading zero; empty if there is none.
std::string addressBy(int (*call)(int, sockaddr*, socklen_t*), int socket) {
  sockaddr_un address{};
  socklen_t size = sizeof address;
  if (call(socket, reinterpret_cast<sockaddr*>(&address), &size) != 0 || size <= kPathOffset) return {};
  return {address.sun_path, std::min<std::size_t>(size - kPathOffset, sizeof address.sun_path)};
}

}  // namespace

std::unique_ptr<HeldAddresses::Entry> HeldAddresses::add(int socket) {
  // Just the family: the kernel chooses an address, and leaves one that is there. Without one the socket is
  // not found again; that is no reason to turn its client away.
  const sockaddr_un any{AF_UNIX, {}};
  (void)::bind(socket, reinterpret_cast<const sockaddr*>(&any), kPathOffset);
  const auto at = addresses_.insert(addressBy(::getsockname, socket));
  try {
    return std::make_unique<Entry>(shared_from_this(), at);
  } catch (...) {
    addresses_.erase(at);
    throw;
  }
}

bool HeldAddresses::hasOtherEndOf(int socket) const {
  const std::string address = addressBy(::getpeername, socket);
  return !address.empty() && addresses_.contains(address);
}

}  // namespace brenvik
