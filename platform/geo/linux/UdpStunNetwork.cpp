// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/UdpStunNetwork.h"

#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/geo/linux/HostResolver.h"

namespace brenvik {
namespace {

// More than a binding answer ever has (RFC 8489: at most 576 bytes over IPv4, 1280 over IPv6).
constexpr std::size_t kLargestDatagram = 1500;

}  // namespace

UdpStunNetwork::UdpStunNetwork(std::string server, int stopFd)
    : server_(std::move(server)), stopFd_(stopFd) {}

std::chrono::nanoseconds UdpStunNetwork::elapsed() { return std::chrono::steady_clock::now() - start_; }

std::size_t UdpStunNetwork::findPeers(std::chrono::nanoseconds until) {
  const auto patience = std::chrono::ceil<std::chrono::milliseconds>(until - elapsed());
  std::vector<sa_family_t> families;
  for (const auto& address : resolveUdp(splitHostAndPort(server_, "3478"), patience, stopFd_)) {
    const sa_family_t family = address.storage.ss_family;
    if (std::find(families.begin(), families.end(), family) != families.end()) continue;
    families.push_back(family);
    UniqueFd socket(::socket(family, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    // Connected: the kernel then drops what others send, and reports that nobody listens there.
    if (socket.isValid() &&
        ::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address.storage), address.size) != 0) {
      socket.reset();
    }
    sockets_.push_back(std::move(socket));
  }
  return sockets_.size();
}

bool UdpStunNetwork::send(std::size_t peer, std::span<const std::byte> datagram) {
  UniqueFd& socket = sockets_[peer];
  if (!socket.isValid()) return false;
  if (::send(socket.get(), datagram.data(), datagram.size(), MSG_NOSIGNAL) >= 0) return true;
  // A full queue is like a datagram lost: the next sending makes up for it.
  if (errno == EAGAIN || errno == ENOBUFS || errno == EINTR) return true;
  socket.reset();
  return false;
}

StunNetwork::Event UdpStunNetwork::wait(std::chrono::nanoseconds until) {
  for (;;) {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(until - elapsed());
    std::vector<pollfd> entries{{stopFd_, POLLIN, 0}};
    // poll(2) passes over the negative descriptor of a peer that has failed.
    for (const UniqueFd& socket : sockets_) entries.push_back({socket.get(), POLLIN, 0});
    const int timeOut = static_cast<int>(std::max<std::int64_t>(left.count(), 0));
    const int ready = ::poll(entries.data(), entries.size(), timeOut);
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) return {};
    if (entries[0].revents != 0) return {Event::Kind::stopped, 0, {}};
    for (std::size_t i = 0; i < sockets_.size(); ++i) {
      if (entries[i + 1].revents == 0) continue;
      std::vector<std::byte> bytes(kLargestDatagram);
      const ssize_t size = ::recv(sockets_[i].get(), bytes.data(), bytes.size(), 0);
      if (size < 0 && (errno == EAGAIN || errno == EINTR)) continue;
      if (size < 0) {
        sockets_[i].reset();
        return {Event::Kind::peerFailed, i, {}};
      }
      bytes.resize(static_cast<std::size_t>(size));
      return {Event::Kind::datagram, i, std::move(bytes)};
    }
  }
}

}  // namespace brenvik
