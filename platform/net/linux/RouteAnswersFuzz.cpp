// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Answers about routes. The input describes messages with attributes and hops, whose lengths may lie; or it
// is the answer.
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <sys/socket.h>

#include <array>
#include <cstring>
#include <vector>

#include "platform/base/fakes/FuzzInput.h"
#include "platform/net/linux/RouteAnswers.h"

namespace {

using namespace brenvik;

using Bytes = std::vector<std::byte>;

template <class Struct>
void append(Bytes& bytes, const Struct& value) {
  const auto raw = std::as_bytes(std::span(&value, 1));
  bytes.insert(bytes.end(), raw.begin(), raw.end());
}
void pad(Bytes& bytes) { bytes.resize((bytes.size() + 3) & ~std::size_t{3}); }

// As a rule the truth.
std::uint16_t lengthOf(FuzzInput& input, std::size_t truth) {
  return static_cast<std::uint16_t>(input.byte() % 16 == 15 ? input.number(2) : truth);
}

Bytes hops(FuzzInput& input) {
  Bytes bytes;
  for (std::size_t count = input.below(4); count > 0; --count) {
    append(bytes, rtnexthop{lengthOf(input, sizeof(rtnexthop)), static_cast<unsigned char>(input.below(4)), 0,
                            static_cast<int>(input.number(1))});
  }
  return bytes;
}

Bytes attribute(FuzzInput& input) {
  Bytes payload;
  static constexpr std::array<unsigned short, 4> kTypes{RTA_DST, RTA_OIF, RTA_MULTIPATH, RTA_GATEWAY};
  const unsigned short type = input.oneOf(kTypes);
  if (type == RTA_MULTIPATH) {
    payload = hops(input);
  } else if (type == RTA_OIF) {
    append(payload, static_cast<std::int32_t>(input.number(input.flag() ? 4 : 1)));
  } else {
    const auto some = input.bytes(input.flag() ? 16 : 4);
    payload.assign(some.begin(), some.end());
  }
  Bytes bytes;
  append(bytes, rtattr{lengthOf(input, sizeof(rtattr) + payload.size()), type});
  bytes.insert(bytes.end(), payload.begin(), payload.end());
  pad(bytes);
  return bytes;
}

Bytes answer(FuzzInput& input) {
  Bytes bytes;
  if (input.byte() % 4 == 3) {
    const auto rest = input.rest();
    return {rest.begin(), rest.end()};
  }
  for (std::size_t count = input.below(6); count > 0; --count) {
    static constexpr std::array<std::uint16_t, 4> kTypes{RTM_NEWROUTE, RTM_NEWROUTE, NLMSG_DONE, NLMSG_ERROR};
    Bytes body;
    rtmsg route{};
    route.rtm_family = input.flag() ? AF_INET6 : AF_INET;
    route.rtm_dst_len = input.byte();
    route.rtm_type = static_cast<unsigned char>(input.below(4));
    route.rtm_flags = input.byte() % 8 == 7 ? static_cast<unsigned>(input.number(4)) : 0;
    append(body, route);
    for (std::size_t attributes = input.below(5); attributes > 0; --attributes) {
      const Bytes one = attribute(input);
      body.insert(body.end(), one.begin(), one.end());
    }
    nlmsghdr header{};
    header.nlmsg_type = input.byte() % 8 == 7 ? input.oneOf(kTypes) : std::uint16_t{RTM_NEWROUTE};
    header.nlmsg_len = input.byte() % 16 == 15 ? static_cast<std::uint32_t>(input.number(4))
                                               : static_cast<std::uint32_t>(sizeof header + body.size());
    append(bytes, header);
    bytes.insert(bytes.end(), body.begin(), body.end());
    pad(bytes);
  }
  return bytes;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  FuzzInput input(data, size);
  // A copy of exactly this size, so that a sanitizer sees the first byte read beyond it.
  const Bytes bytes = answer(input);
  constexpr unsigned kLoopback = 1;
  std::optional<unsigned> index;
  (void)readRoute(bytes, &index);
  require(!index || (*index > 0 && *index <= 0x7FFFFFFF));
  std::set<unsigned> interfaces;
  for (const std::uint8_t family : {std::uint8_t{AF_INET}, std::uint8_t{AF_INET6}})
    (void)readRoutes(bytes, family, kLoopback, &interfaces);
  require(!interfaces.contains(kLoopback) && !interfaces.contains(0));
  require(interfaces.empty() || *interfaces.rbegin() <= 0x7FFFFFFF);
  return 0;
}
