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

namespace brenvik {
namespace {

// A dump arrives in pieces of at most this size.
constexpr std::size_t kReceiveSize = 32768;
// The kernel answers at once; a lost answer must not hold the caller for ever.
constexpr timeval kAnswerTimeOut{2, 0};

constexpr std::size_t aligned(std::size_t length) noexcept { return (length + 3) & ~std::size_t{3}; }

template <typename T>
std::optional<T> readAt(std::span<const std::byte> bytes, std::size_t offset = 0) noexcept {
  if (bytes.size() < offset + sizeof(T)) return std::nullopt;
  T value;
  std::memcpy(&value, bytes.data() + offset, sizeof value);
  return value;
}

// Calls `visit(type, payload)` for each attribute of a run of them.
template <typename Visit>
void forEachAttribute(std::span<const std::byte> bytes, Visit visit) {
  while (const auto attribute = readAt<rtattr>(bytes)) {
    if (attribute->rta_len < sizeof(rtattr) || attribute->rta_len > bytes.size()) return;
    visit(attribute->rta_type, bytes.subspan(sizeof(rtattr), attribute->rta_len - sizeof(rtattr)));
    bytes = bytes.subspan(std::min(bytes.size(), aligned(attribute->rta_len)));
  }
}

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

enum class Answer { goesOn, complete, failed };

// Calls `visit(rtmsg, attributes)` for each route in a piece of the answer.
template <typename Visit>
Answer visitRoutes(std::span<const std::byte> piece, bool isDump, Visit& visit) {
  while (const auto header = readAt<nlmsghdr>(piece)) {
    if (header->nlmsg_len < sizeof(nlmsghdr) || header->nlmsg_len > piece.size()) return Answer::failed;
    if (header->nlmsg_type == NLMSG_DONE) return Answer::complete;
    if (header->nlmsg_type == NLMSG_ERROR) return Answer::failed;
    const auto message = piece.subspan(sizeof(nlmsghdr), header->nlmsg_len - sizeof(nlmsghdr));
    if (header->nlmsg_type == RTM_NEWROUTE) {
      if (const auto route = readAt<rtmsg>(message)) visit(*route, message.subspan(aligned(sizeof(rtmsg))));
      if (!isDump) return Answer::complete;
    }
    piece = piece.subspan(std::min(piece.size(), aligned(header->nlmsg_len)));
  }
  return Answer::goesOn;
}

// Sends the request and calls `visit(rtmsg, attributes)` for each route of the answer. False when the kernel
// reported an error or did not answer.
template <typename Visit>
bool ask(const RouteRequest& request, Visit visit) {
  const UniqueFd fd = sent(request);
  if (!fd.isValid()) return false;
  const bool isDump = (request.header.nlmsg_flags & NLM_F_DUMP) == NLM_F_DUMP;
  std::vector<std::byte> buffer(kReceiveSize);
  for (auto answer = Answer::goesOn; answer != Answer::complete;) {
    const auto received = ::recv(fd.get(), buffer.data(), buffer.size(), 0);
    if (received < 0 && errno == EINTR) continue;
    if (received <= 0) return false;
    answer = visitRoutes(std::span(buffer.data(), static_cast<std::size_t>(received)), isDump, visit);
    if (answer == Answer::failed) return false;
  }
  return true;
}

bool isLinkLocal(const rtmsg& route, std::span<const std::byte> destination) noexcept {
  const auto byteAt = [&](std::size_t i) {
    return i < destination.size() ? std::to_integer<unsigned>(destination[i]) : 0U;
  };
  if (route.rtm_family == AF_INET6 && route.rtm_dst_len >= 8) {
    return byteAt(0) == 0xFF || (byteAt(0) == 0xFE && (byteAt(1) & 0xC0U) == 0x80);
  }
  if (route.rtm_family == AF_INET && route.rtm_dst_len >= 16) return byteAt(0) == 169 && byteAt(1) == 254;
  return false;
}

// Calls `take(index)` for each living hop of a route with several.
template <typename Take>
void forEachHop(std::span<const std::byte> hops, Take take) {
  while (const auto hop = readAt<rtnexthop>(hops)) {
    if (hop->rtnh_len < sizeof(rtnexthop) || hop->rtnh_len > hops.size()) return;
    if ((hop->rtnh_flags & RTNH_F_DEAD) == 0) take(hop->rtnh_ifindex);
    hops = hops.subspan(std::min(hops.size(), aligned(hop->rtnh_len)));
  }
}

void collect(const rtmsg& route, std::span<const std::byte> attributes, unsigned loopback,
             std::set<unsigned>& interfaces) {
  if (route.rtm_type != RTN_UNICAST || (route.rtm_flags & (RTNH_F_DEAD | RTM_F_CLONED)) != 0) return;
  std::span<const std::byte> destination;
  forEachAttribute(attributes, [&](unsigned type, std::span<const std::byte> payload) {
    if (type == RTA_DST) destination = payload;
  });
  if (isLinkLocal(route, destination)) return;
  const auto take = [&](int index) {
    if (index > 0 && static_cast<unsigned>(index) != loopback)
      interfaces.insert(static_cast<unsigned>(index));
  };
  forEachAttribute(attributes, [&](unsigned type, std::span<const std::byte> payload) {
    if (type == RTA_OIF) {
      if (const auto index = readAt<int>(payload)) take(*index);
    } else if (type == RTA_MULTIPATH) {
      forEachHop(payload, take);
    }
  });
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
  const bool answered = ask(request, [&](const rtmsg& route, std::span<const std::byte> attributes) {
    if (route.rtm_type != RTN_UNICAST && route.rtm_type != RTN_LOCAL) return;
    forEachAttribute(attributes, [&](unsigned type, std::span<const std::byte> payload) {
      const auto index = type == RTA_OIF ? readAt<int>(payload) : std::nullopt;
      if (index && *index > 0) found = static_cast<unsigned>(*index);
    });
  });
  return answered ? found : std::nullopt;
}

std::optional<std::set<unsigned>> interfacesWithRoutes() {
  std::set<unsigned> interfaces;
  const unsigned loopback = ::if_nametoindex("lo");
  bool answered = false;
  for (const std::uint8_t family : {std::uint8_t{AF_INET}, std::uint8_t{AF_INET6}}) {
    // A kernel without IPv6 refuses its dump; the other one still tells.
    answered |=
        ask(makeRequest(NLM_F_DUMP, family), [&](const rtmsg& route, std::span<const std::byte> attributes) {
          if (route.rtm_family == family) collect(route, attributes, loopback, interfaces);
        });
  }
  if (!answered) return std::nullopt;
  return interfaces;
}

}  // namespace brenvik
