// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/net/linux/RouteAnswers.h"

#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <sys/socket.h>

#include <algorithm>
#include <cstring>

namespace brenvik {
namespace {

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

// Calls `visit(rtmsg, attributes)` for each route in a piece of the answer.
template <typename Visit>
RouteAnswer visitRoutes(std::span<const std::byte> piece, bool isDump, Visit visit) {
  while (const auto header = readAt<nlmsghdr>(piece)) {
    if (header->nlmsg_len < sizeof(nlmsghdr) || header->nlmsg_len > piece.size()) return RouteAnswer::failed;
    if (header->nlmsg_type == NLMSG_DONE) return RouteAnswer::complete;
    if (header->nlmsg_type == NLMSG_ERROR) return RouteAnswer::failed;
    const auto message = piece.subspan(sizeof(nlmsghdr), header->nlmsg_len - sizeof(nlmsghdr));
    if (header->nlmsg_type == RTM_NEWROUTE) {
      if (const auto route = readAt<rtmsg>(message)) visit(*route, message.subspan(aligned(sizeof(rtmsg))));
      if (!isDump) return RouteAnswer::complete;
    }
    piece = piece.subspan(std::min(piece.size(), aligned(header->nlmsg_len)));
  }
  return RouteAnswer::goesOn;
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

RouteAnswer readRoute(std::span<const std::byte> piece, std::optional<unsigned>* index) {
  return visitRoutes(piece, false, [&](const rtmsg& route, std::span<const std::byte> attributes) {
    if (route.rtm_type != RTN_UNICAST && route.rtm_type != RTN_LOCAL) return;
    forEachAttribute(attributes, [&](unsigned type, std::span<const std::byte> payload) {
      const auto found = type == RTA_OIF ? readAt<int>(payload) : std::nullopt;
      if (found && *found > 0) *index = static_cast<unsigned>(*found);
    });
  });
}

RouteAnswer readRoutes(std::span<const std::byte> piece, std::uint8_t family, unsigned loopback,
                       std::set<unsigned>* interfaces) {
  return visitRoutes(piece, true, [&](const rtmsg& route, std::span<const std::byte> attributes) {
    if (route.rtm_family == family) collect(route, attributes, loopback, *interfaces);
  });
}

}  // namespace brenvik
