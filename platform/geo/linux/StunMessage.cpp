// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/StunMessage.h"

#include <arpa/inet.h>
#include <netinet/in.h>

#include <algorithm>
#include <cstdint>
#include <cstring>

namespace brenvik {
namespace {

constexpr std::size_t kHeaderSize = 20;
constexpr std::uint16_t kBindingRequest = 0x0001;
constexpr std::uint16_t kBindingSuccess = 0x0101;
constexpr std::uint16_t kBindingError = 0x0111;
constexpr std::uint16_t kXorMappedAddress = 0x0020;
constexpr std::uint8_t kFamilyIpv4 = 1;
constexpr std::uint8_t kFamilyIpv6 = 2;
constexpr std::array kMagicCookie{std::byte{0x21}, std::byte{0x12}, std::byte{0xA4}, std::byte{0x42}};

std::uint16_t bigEndian16(std::span<const std::byte> bytes) noexcept {
  return static_cast<std::uint16_t>(std::to_integer<unsigned>(bytes[0]) << 8 |
                                    std::to_integer<unsigned>(bytes[1]));
}

// Of the attributes that nobody may pass over (below 0x8000), those that RFC 8489 knows, or that its
// forerunners had in answers: 0x0004 and 0x0005 still come from old servers.
constexpr bool mayBePassedOver(std::uint16_t attribute) noexcept {
  return attribute >= 0x8000 || (attribute >= 0x0001 && attribute <= 0x000B) || attribute == 0x0014 ||
         attribute == 0x0015 || (attribute >= 0x001C && attribute <= 0x001E);
}

// The value of XOR-MAPPED-ADDRESS: a zero, the family, the port, the address; the latter two xor'ed with the
// cookie and, after it, the transaction id. Empty when no host can have it.
std::string addressIn(std::span<const std::byte> value, const StunTransactionId& id) {
  if (value.size() < 4) return {};
  const auto family = std::to_integer<std::uint8_t>(value[1]);
  const std::size_t length = family == kFamilyIpv4 ? 4 : family == kFamilyIpv6 ? 16 : 0;
  if (length == 0 || value.size() != 4 + length) return {};
  std::array<std::byte, 16> key;
  std::copy(kMagicCookie.begin(), kMagicCookie.end(), key.begin());
  std::copy(id.begin(), id.end(), key.begin() + kMagicCookie.size());
  std::array<std::byte, 16> address{};
  for (std::size_t i = 0; i < length; ++i) address[i] = value[4 + i] ^ key[i];

  if (family == kFamilyIpv4) {
    in_addr ipv4;
    std::memcpy(&ipv4, address.data(), sizeof ipv4);
    const std::uint32_t number = ntohl(ipv4.s_addr);
    // 0/8 is "this network", 224/4 and above multicast, reserved and broadcast.
    if (number >> 24 == 0 || number >> 28 >= 14) return {};
    std::array<char, INET_ADDRSTRLEN> text;
    return ::inet_ntop(AF_INET, &ipv4, text.data(), text.size()) != nullptr ? text.data() : std::string();
  }
  in6_addr ipv6;
  std::memcpy(&ipv6, address.data(), sizeof ipv6);
  if (IN6_IS_ADDR_UNSPECIFIED(&ipv6) || IN6_IS_ADDR_MULTICAST(&ipv6)) return {};
  std::array<char, INET6_ADDRSTRLEN> text;
  return ::inet_ntop(AF_INET6, &ipv6, text.data(), text.size()) != nullptr ? text.data() : std::string();
}

}  // namespace

StunRequest makeStunBindingRequest(const StunTransactionId& id) noexcept {
  StunRequest request{};
  request[1] = std::byte{kBindingRequest};
  std::copy(kMagicCookie.begin(), kMagicCookie.end(), request.begin() + 4);
  std::copy(id.begin(), id.end(), request.begin() + 8);
  return request;
}

StunAnswer readStunAnswer(std::span<const std::byte> datagram, const StunTransactionId& id) {
  if (datagram.size() < kHeaderSize || datagram.size() % 4 != 0) return {};
  if (bigEndian16(datagram.subspan(2)) != datagram.size() - kHeaderSize) return {};
  if (!std::equal(kMagicCookie.begin(), kMagicCookie.end(), datagram.begin() + 4)) return {};
  if (!std::equal(id.begin(), id.end(), datagram.begin() + 8)) return {};
  const std::uint16_t type = bigEndian16(datagram);
  if (type == kBindingError) return {StunVerdict::refused, {}};
  if (type != kBindingSuccess) return {};

  // Of an attribute given twice, the first counts.
  std::string address;
  bool found = false;
  for (auto rest = datagram.subspan(kHeaderSize); !rest.empty();) {
    // The rest is a multiple of four, so a whole attribute header is left; its padded value may not be.
    const std::uint16_t attribute = bigEndian16(rest);
    const std::size_t length = bigEndian16(rest.subspan(2));
    const std::size_t padded = (length + 3) / 4 * 4;
    rest = rest.subspan(4);
    if (padded > rest.size()) return {};
    if (attribute == kXorMappedAddress && !found) {
      found = true;
      address = addressIn(rest.first(length), id);
    } else if (attribute != kXorMappedAddress && !mayBePassedOver(attribute)) {
      return {};
    }
    rest = rest.subspan(padded);
  }
  if (address.empty()) return {StunVerdict::noAddress, {}};
  return {StunVerdict::address, std::move(address)};
}

}  // namespace brenvik
