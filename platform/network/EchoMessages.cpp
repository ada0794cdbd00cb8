// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/network/EchoMessages.h"

#include <cstring>
#include <limits>
#include <string_view>
#include <utility>

#include "platform/network/ErrorNumbers.h"
#include "platform/worker/WorkerFields.h"

namespace brenvik {

std::vector<std::byte> encodeName(const char* name) { return FieldWriter().text(name).take(); }

std::optional<std::string> decodeName(std::span<const std::byte> payload) {
  FieldReader from(payload);
  const std::string name(from.text());
  if (!from.whole() || name.size() > kLongestName || name.find('\0') != std::string::npos)
    return std::nullopt;
  return name;
}

std::vector<std::byte> encodeNumber(std::optional<std::uint32_t> number) {
  FieldWriter to;
  to.optional(number, [](FieldWriter& writer, std::uint32_t it) { writer.u32(it); });
  return to.take();
}

std::optional<std::optional<std::uint32_t>> decodeNumber(std::span<const std::byte> payload) {
  FieldReader from(payload);
  const auto number = from.optional([](FieldReader& reader) { return reader.u32(); });
  if (!from.whole()) return std::nullopt;
  return std::optional<std::optional<std::uint32_t>>(std::in_place, number);
}

std::vector<std::byte> encodeSocket(int protocol, std::uint16_t identifier) {
  return FieldWriter().u32(static_cast<std::uint32_t>(protocol)).u32(identifier).take();
}

std::optional<EchoSocketQuestion> decodeSocket(std::span<const std::byte> payload) {
  FieldReader from(payload);
  const auto protocol = from.u32();
  const auto identifier = from.u32();
  if (!from.whole() || protocol > 255 || identifier > std::numeric_limits<std::uint16_t>::max())
    return std::nullopt;
  return EchoSocketQuestion{static_cast<int>(protocol), static_cast<std::uint16_t>(identifier)};
}

std::vector<std::byte> encode(EchoSocketForm form) {
  return FieldWriter().u8(static_cast<std::uint8_t>(form)).take();
}

std::optional<EchoSocketForm> decodeForm(std::span<const std::byte> payload) {
  FieldReader from(payload);
  const auto form = from.u8();
  if (!from.whole() || form > static_cast<std::uint8_t>(EchoSocketForm::withIpHeader)) return std::nullopt;
  return static_cast<EchoSocketForm>(form);
}

std::vector<std::byte> encodeSend(in_addr destination, std::span<const std::byte> message) {
  return FieldWriter().u32(destination.s_addr).bytes(message).take();
}

std::optional<EchoSendQuestion> decodeSend(std::span<const std::byte> payload) {
  FieldReader from(payload);
  EchoSendQuestion question{};
  question.destination.s_addr = from.u32();
  question.message = from.bytes();
  if (!from.whole() || question.message.size() > kLongestEcho) return std::nullopt;
  return question;
}

std::vector<std::byte> encodeTransfer(const EchoTransfer& transfer, std::span<const std::byte> bytes) {
  return FieldWriter()
      .i64(transfer.count)
      .u32(static_cast<std::uint32_t>(transfer.error))
      .bytes(bytes)
      .take();
}

std::optional<EchoAnswer> decodeTransfer(std::span<const std::byte> payload, std::size_t largest) {
  FieldReader from(payload);
  EchoAnswer answer;
  const auto count = from.i64();
  const auto error = from.u32();
  const auto bytes = from.bytes();
  if (!from.whole() || !isErrorNumber(error) || count < -1 || count > static_cast<std::int64_t>(largest))
    return std::nullopt;
  if (!bytes.empty() && static_cast<std::int64_t>(bytes.size()) != count) return std::nullopt;
  answer.transfer = {static_cast<std::ptrdiff_t>(count), static_cast<int>(error)};
  answer.bytes.assign(bytes.begin(), bytes.end());
  return answer;
}

}  // namespace brenvik
