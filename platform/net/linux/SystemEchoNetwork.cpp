// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/net/linux/SystemEchoNetwork.h"

#include <arpa/inet.h>
#include <net/if.h>
#include <netdb.h>
#include <sys/socket.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <new>
#include <utility>

#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

enum class SocketForm { datagram, raw };

class SystemEchoSocket final : public EchoSocket {
 public:
  SystemEchoSocket(UniqueFd fd, SocketForm form) noexcept : fd_(std::move(fd)), form_(form) {}

  void setReceiveBufferSize(int bytes) noexcept override {
    (void)::setsockopt(fd_.get(), SOL_SOCKET, SO_RCVBUF, &bytes, sizeof bytes);  // as promised, not told
  }

  void bindToInterface(unsigned index) noexcept override {
    const int value = static_cast<int>(index);
    (void)::setsockopt(fd_.get(), SOL_SOCKET, SO_BINDTOIFINDEX, &value,
                       sizeof value);  // as promised, not told
  }

  int setReceiveTimeOut(std::chrono::microseconds timeOut) noexcept override {
    timeval value{};
    value.tv_sec = timeOut.count() / 1'000'000;
    value.tv_usec = timeOut.count() % 1'000'000;
    return ::setsockopt(fd_.get(), SOL_SOCKET, SO_RCVTIMEO, &value, sizeof value) == 0 ? 0 : errno;
  }

  EchoTransfer sendTo(in_addr destination, std::span<const std::byte> message) noexcept override {
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_addr = destination;
    errno = 0;
    const auto sent = ::sendto(fd_.get(), message.data(), message.size(), MSG_NOSIGNAL,
                               reinterpret_cast<const sockaddr*>(&to), sizeof to);
    return {sent, sent < 0 ? errno : 0};
  }

  EchoTransfer receive(std::span<std::byte> buffer) noexcept override {
    const auto received = ::recvfrom(fd_.get(), buffer.data(), buffer.size(), 0, nullptr, nullptr);
    return {received, received < 0 ? errno : 0};
  }

  bool deliversIpHeader() const noexcept override { return form_ == SocketForm::raw; }

 private:
  const UniqueFd fd_;
  const SocketForm form_;
};

// The kernel writes the bound port over a message's identifier, and picks one when none is bound (or 0 is).
UniqueFd datagramSocket(int protocol, std::uint16_t identifier) noexcept {
  if (identifier == 0) return UniqueFd();
  UniqueFd fd(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, protocol));
  if (!fd.isValid()) return fd;
  sockaddr_in self{};
  self.sin_family = AF_INET;
  self.sin_port = htons(identifier);
  if (::bind(fd.get(), reinterpret_cast<const sockaddr*>(&self), sizeof self) != 0) fd.reset();
  return fd;
}

}  // namespace

std::optional<in_addr> SystemEchoNetwork::addressOfHost(const char* name) noexcept {
  std::array<char, 4096> space;
  hostent entry{};
  hostent* found = nullptr;
  int hostError = 0;
  if (::gethostbyname_r(name, &entry, space.data(), space.size(), &found, &hostError) != 0 ||
      found == nullptr || found->h_addrtype != AF_INET || found->h_addr_list[0] == nullptr) {
    return std::nullopt;
  }
  in_addr address{};
  std::memcpy(&address, found->h_addr_list[0], sizeof address);
  return address;
}

std::optional<int> SystemEchoNetwork::protocolByName(const char* name) noexcept {
  std::array<char, 1024> space;
  protoent entry{};
  protoent* found = nullptr;
  if (::getprotobyname_r(name, &entry, space.data(), space.size(), &found) != 0 || found == nullptr) {
    return std::nullopt;
  }
  return found->p_proto;
}

std::unique_ptr<EchoSocket> SystemEchoNetwork::openEchoSocket(int protocol,
                                                              std::uint16_t identifier) noexcept {
  auto form = SocketForm::datagram;
  UniqueFd fd = datagramSocket(protocol, identifier);
  if (!fd.isValid()) {
    // net.ipv4.ping_group_range is closed on most systems, to root as well; a raw socket needs CAP_NET_RAW.
    form = SocketForm::raw;
    fd.reset(::socket(AF_INET, SOCK_RAW | SOCK_CLOEXEC, protocol));
    if (!fd.isValid()) return nullptr;
  }
  return std::unique_ptr<EchoSocket>(new (std::nothrow) SystemEchoSocket(std::move(fd), form));
}

unsigned SystemEchoNetwork::indexOfInterface(const char* name) noexcept { return ::if_nametoindex(name); }

int SystemEchoNetwork::timeOfDay(timeval* now) noexcept { return ::gettimeofday(now, nullptr); }

std::chrono::microseconds SystemEchoNetwork::steadyTime() noexcept {
  return std::chrono::duration_cast<std::chrono::microseconds>(
      std::chrono::steady_clock::now().time_since_epoch());
}

}  // namespace brenvik
