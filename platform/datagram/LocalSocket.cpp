// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/datagram/LocalSocket.h"

#include <array>
#include <cerrno>

namespace brenvik {
namespace {

constexpr int kType = SOCK_SEQPACKET | SOCK_CLOEXEC;

bool has(int descriptor, int option, int wanted) noexcept {
  int value = -1;
  socklen_t size = sizeof value;
  return ::getsockopt(descriptor, SOL_SOCKET, option, &value, &size) == 0 && value == wanted;
}

const sockaddr* generic(const sockaddr_un& address) noexcept {
  return reinterpret_cast<const sockaddr*>(&address);
}

}  // namespace

std::optional<sockaddr_un> socketAddress(std::string_view path) noexcept {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof address.sun_path) return std::nullopt;
  path.copy(address.sun_path, path.size());
  return address;
}

std::optional<sockaddr_un> socketAddress(std::string_view directory, std::string_view name) noexcept {
  std::array<char, sizeof(sockaddr_un::sun_path)> path;
  const std::size_t length = directory.size() + 1 + name.size();
  if (length >= path.size()) return std::nullopt;
  char* const end = path.data() + directory.copy(path.data(), directory.size());
  *end = '/';
  name.copy(end + 1, name.size());
  return socketAddress({path.data(), length});
}

UniqueFd makeSocket(Blocking blocking) noexcept {
  return UniqueFd(::socket(AF_UNIX, blocking == Blocking::yes ? kType : kType | SOCK_NONBLOCK, 0));
}

int makeSocketPair(UniqueFd* one, UniqueFd* other) noexcept {
  std::array<int, 2> ends{};
  if (::socketpair(AF_UNIX, kType, 0, ends.data()) != 0) return errno;
  one->reset(ends[0]);
  other->reset(ends[1]);
  return 0;
}

int connectSocket(int socket, const sockaddr_un& address) noexcept {
  return ::connect(socket, generic(address), sizeof address);
}

int bindSocket(int socket, const sockaddr_un& address) noexcept {
  return ::bind(socket, generic(address), sizeof address);
}

bool isLocalSocket(int descriptor) noexcept {
  return has(descriptor, SO_DOMAIN, AF_UNIX) && has(descriptor, SO_TYPE, SOCK_SEQPACKET);
}

bool isLocalSocket(int descriptor, Listening listening) noexcept {
  return isLocalSocket(descriptor) && has(descriptor, SO_ACCEPTCONN, listening == Listening::yes ? 1 : 0);
}

std::optional<ucred> peerOf(int connection) noexcept {
  ucred peer{};
  socklen_t size = sizeof peer;
  if (::getsockopt(connection, SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0) return std::nullopt;
  return peer;
}

bool askForCredentials(int socket) noexcept {
  const int on = 1;
  return ::setsockopt(socket, SOL_SOCKET, SO_PASSCRED, &on, sizeof on) == 0;
}

bool isDrained(int socket) noexcept {
  if (!askForCredentials(socket)) return false;
  // No room for anything: what there is shows as cut. So no descriptor comes in, either.
  msghdr message{};
  return ::recvmsg(socket, &message, MSG_PEEK | MSG_DONTWAIT) == 0 && message.msg_flags == 0;
}

}  // namespace brenvik
