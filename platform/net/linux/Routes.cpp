// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/net/linux/Routes.h"

#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <net/if.h>
#include <netinet/in.h>

#include <array>
#include <cerrno>
#include <cstddef>
#include <cstring>
#include <span>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/net/linux/RouteAnswers.h"

namespace brenvik {
namespace {

// A dump arrives in pieces of at most this size.
constexpr std::size_t kReceiveSize = 32768;
// The kernel answers at once; a lost answer must not hold the caller for ever.
constexpr timeval kAnswerTimeOut{2, 0};

constexpr std::size_t aligned(std::size_t length) noexcept { return (length + 3) & ~std::size_t{3}; }

struct RouteRequest {
  nlmsghdr header;
  rtmsg route;
  std::array<std::byte, 64> attributes;
};

void addAttribute(RouteRequest& request, std::uint16_t type, std::span<const std::byte> payload) noexcept {
  const rtattr attribute{static_cast<unsigned short>(sizeof(rtattr) + payload.size()), type};
  std::byte* at = reinterpret_cast<std::byte*>(&request) + aligned(request.header.nlmsg_len);
  std::memcpy(at, &attribute, sizeof attribute);
  std::memcpy(at + sizeof attribute, payload.data(), payload.size());
  request.header.nlmsg_len =
      static_cast<std::uint32_t>(aligned(request.header.nlmsg_len) + aligned(attribute.rta_len));
}

RouteRequest makeRequest(std::uint16_t flags, std::uint8_t family) noexcept {
  RouteRequest request{};
  request.header.nlmsg_len = NLMSG_LENGTH(sizeof(rtmsg));
  request.header.nlmsg_type = RTM_GETROUTE;
  request.header.nlmsg_flags = static_cast<std::uint16_t>(NLM_F_REQUEST | flags);
  request.header.nlmsg_seq = 1;
  request.route.rtm_family = family;
  return request;
}

// A socket that the kernel has the request on; invalid when it cannot be had.
UniqueFd sent(const RouteRequest& request) noexcept {
  UniqueFd fd(::socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, NETLINK_ROUTE));
  if (!fd.isValid()) return {};
  (void)::setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &kAnswerTimeOut, sizeof kAnswerTimeOut);
  sockaddr_nl kernel{};
  kernel.nl_family = AF_NETLINK;
  if (::connect(fd.get(), reinterpret_cast<const sockaddr*>(&kernel), sizeof kernel) != 0) return {};
  if (::send(fd.get(), &request, request.header.nlmsg_len, 0) < 0) return {};
  return fd;
}

// Sends the request and hands each piece of the answer to `read`. False when the kernel reported an error or
// did not answer.
template <typename Read>
bool ask(const RouteRequest& request, Read read) {
  const UniqueFd fd = sent(request);
  if (!fd.isValid()) return false;
  std::vector<std::byte> buffer(kReceiveSize);
  for (auto answer = RouteAnswer::goesOn; answer != RouteAnswer::complete;) {
    const auto received = ::recv(fd.get(), buffer.data(), buffer.size(), 0);
    if (received < 0 && errno == EINTR) continue;
    if (received <= 0) return false;
    answer = read(std::span<const std::byte>(buffer.data(), static_cast<std::size_t>(received)));
    if (answer == RouteAnswer::failed) return false;
  }
  return true;
}

}  // namespace

std::optional<unsigned> interfaceTo(const sockaddr& peer) {
  std::array<std::byte, 16> address{};
  std::size_t length = 0;
  auto family = static_cast<std::uint8_t>(peer.sa_family);
  if (peer.sa_family == AF_INET) {
    sockaddr_in v4{};
    std::memcpy(&v4, &peer, sizeof v4);
    length = sizeof v4.sin_addr;
    std::memcpy(address.data(), &v4.sin_addr, length);
  } else if (peer.sa_family == AF_INET6) {
    sockaddr_in6 v6{};
    std::memcpy(&v6, &peer, sizeof v6);
    if (IN6_IS_ADDR_LINKLOCAL(&v6.sin6_addr) && v6.sin6_scope_id != 0) return v6.sin6_scope_id;
    if (IN6_IS_ADDR_V4MAPPED(&v6.sin6_addr)) {
      // Such an address is spoken to over IPv4, whose routes are other ones.
      family = AF_INET;
      length = sizeof(in_addr);
      std::memcpy(address.data(), v6.sin6_addr.s6_addr + 12, length);
    } else {
      length = sizeof v6.sin6_addr;
      std::memcpy(address.data(), &v6.sin6_addr, length);
    }
  } else {
    return std::nullopt;
  }
  RouteRequest request = makeRequest(0, family);
  request.route.rtm_dst_len = static_cast<unsigned char>(length * 8);
  addAttribute(request, RTA_DST, std::span(address).first(length));

  std::optional<unsigned> found;
  const bool answered =
      ask(request, [&](std::span<const std::byte> piece) { return readRoute(piece, &found); });
  return answered ? found : std::nullopt;
}

std::optional<std::set<unsigned>> interfacesWithRoutes() {
  std::set<unsigned> interfaces;
  const unsigned loopback = ::if_nametoindex("lo");
  bool answered = false;
  for (const std::uint8_t family : {std::uint8_t{AF_INET}, std::uint8_t{AF_INET6}}) {
    // A kernel without IPv6 refuses its dump; the other one still tells.
    answered |= ask(makeRequest(NLM_F_DUMP, family), [&](std::span<const std::byte> piece) {
      return readRoutes(piece, family, loopback, &interfaces);
    });
  }
  if (!answered) return std::nullopt;
  return interfaces;
}

}  // namespace brenvik
