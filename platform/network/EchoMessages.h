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

// The longest echo message that is sent or received; and the longest name that is looked up.
inline constexpr std::size_t kLongestEcho = 4096;
inline constexpr std::size_t kLongestName = 255;

// What one receives or sends, with the bytes that were received.
struct EchoAnswer {
  EchoTransfer transfer;
  std::vector<std::byte> bytes;
};
enum class EchoSocketForm : std::uint8_t { none = 0, withoutIpHeader = 1, withIpHeader = 2 };

// Each has one field or few; a reader gives nothing when they are not all there and no more, or when no
// correct program sends them. All throw std::bad_alloc.
std::vector<std::byte> encodeName(const char* name);
std::optional<std::string> decodeName(std::span<const std::byte> payload);
std::vector<std::byte> encodeNumber(std::optional<std::uint32_t> number);
// The outer one is about the form.
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
// `largest`: of the count; the bytes are as many as the count says, or none.
std::optional<EchoAnswer> decodeTransfer(std::span<const std::byte> payload, std::size_t largest);

}  // namespace brenvik
