// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/net/EchoNetwork.h"

namespace brenvik {

// The longest echo message that is sent or received, and the longest name that is looked up, in bytes.
inline constexpr std::size_t kLongestEcho = 4096;
inline constexpr std::size_t kLongestName = 255;

// What one receives or sends, with the bytes that were received.
struct EchoAnswer {
  EchoTransfer transfer;
  std::vector<std::byte> bytes;
};
enum class EchoSocketForm : std::uint8_t { none = 0, withoutIpHeader = 1, withIpHeader = 2 };

// Each message has a few fields. A decoder returns nothing if the message is malformed, has bytes left over,
// or has values that no correct program sends. All throw std::bad_alloc.
std::vector<std::byte> encodeName(const char* name);
std::optional<std::string> decodeName(std::span<const std::byte> payload);
std::vector<std::byte> encodeNumber(std::optional<std::uint32_t> number);
// The outer optional is empty if the message is malformed.
std::optional<std::optional<std::uint32_t>> decodeNumber(std::span<const std::byte> payload);

std::vector<std::byte> encodeSocket(int protocol, std::uint16_t identifier);
struct EchoSocketQuestion {
  int protocol;
  std::uint16_t identifier;
};
std::optional<EchoSocketQuestion> decodeSocket(std::span<const std::byte> payload);
std::vector<std::byte> encode(EchoSocketForm form);
std::optional<EchoSocketForm> decodeForm(std::span<const std::byte> payload);

std::vector<std::byte> encodeSend(in_addr destination, std::span<const std::byte> message);
struct EchoSendQuestion {
  in_addr destination;
  std::span<const std::byte> message;  // in the payload
};
std::optional<EchoSendQuestion> decodeSend(std::span<const std::byte> payload);
std::vector<std::byte> encodeTransfer(const EchoTransfer& transfer, std::span<const std::byte> bytes);
// `largest` limits the count. The number of bytes must equal the count, or be 0.
std::optional<EchoAnswer> decodeTransfer(std::span<const std::byte> payload, std::size_t largest);

}  // namespace brenvik
