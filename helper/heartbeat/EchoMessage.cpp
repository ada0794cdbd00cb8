// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/heartbeat/EchoMessage.h"

#include <cstring>

namespace brenvik {
namespace {

constexpr std::byte kEchoReplyType{0};
constexpr std::byte kEchoRequestType{8};
constexpr std::size_t kChecksumOffset = 2;
constexpr std::size_t kIdentifierOffset = 4;
constexpr std::size_t kTimestampOffset = 8;

static_assert(sizeof(timeval) == 16, "the time stamp takes two 64-bit fields");
static_assert(kTimestampOffset + sizeof(timeval) <= kEchoMessageSize);

void putNetworkOrder(std::span<std::byte, 2> to, std::uint16_t value) noexcept {
  to[0] = static_cast<std::byte>(value >> 8);
  to[1] = static_cast<std::byte>(value & 0xFF);
}

}  // namespace

std::uint16_t internetChecksum(std::span<const std::byte> bytes) noexcept {
  std::uint64_t sum = 0;
  for (std::size_t i = 0; i < bytes.size(); ++i) {
    const auto value = std::to_integer<std::uint64_t>(bytes[i]);
    sum += i % 2 == 0 ? value << 8 : value;
  }
  while (sum >> 16 != 0) sum = (sum & 0xFFFF) + (sum >> 16);
  return static_cast<std::uint16_t>(~sum & 0xFFFF);
}

EchoMessage makeEchoRequest(std::uint16_t identifier, const timeval& time) noexcept {
  EchoMessage message{};
  const std::span bytes(message);
  message[0] = kEchoRequestType;
  putNetworkOrder(bytes.subspan<kIdentifierOffset, 2>(), identifier);
  std::memcpy(message.data() + kTimestampOffset, &time, sizeof time);
  putNetworkOrder(bytes.subspan<kChecksumOffset, 2>(), internetChecksum(message));
  return message;
}

bool isEchoReply(std::span<const std::byte> datagram, bool afterIpHeader, std::uint16_t identifier) noexcept {
  if (afterIpHeader) {
    if (datagram.empty()) return false;
    const std::size_t headerSize = (std::to_integer<std::size_t>(datagram[0]) & 0x0F) * 4;
    if (headerSize > datagram.size()) return false;
    datagram = datagram.subspan(headerSize);
  }
  if (datagram.size() < kEchoMessageSize || datagram[0] != kEchoReplyType) return false;
  return std::to_integer<unsigned>(datagram[kIdentifierOffset]) == identifier >> 8 &&
         std::to_integer<unsigned>(datagram[kIdentifierOffset + 1]) == (identifier & 0xFFU);
}

}  // namespace brenvik
