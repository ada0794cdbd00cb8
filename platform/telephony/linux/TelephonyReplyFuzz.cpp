// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Any datagrams of a telephony daemon after a push: whole replies, changed ones, and anything else. What the
// connection makes of them is compared with the rule, spelled out here once more: the first datagram that is
// a reply to this push decides, each one before it is a message out of turn.
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "interface/TelephonyMessages.h"
#include "platform/base/fakes/FuzzInput.h"
#include "platform/datagram/Datagram.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/telephony/linux/ChannelTelephonyDaemon.h"

namespace {

using namespace brenvik;

// The daemon's service, in a folder in memory where there is such a place.
struct Service {
  std::string directory =
      ::access("/dev/shm", W_OK) == 0 ? "/dev/shm/telephony-XXXXXX" : "/tmp/telephony-XXXXXX";
  UniqueFd listening = makeSocket(Blocking::no);
  Service() {
    require(::mkdtemp(directory.data()) != nullptr);
    const auto address = socketAddress(directory, kTelephonyServiceName);
    require(address && bindSocket(listening.get(), *address) == 0 && ::listen(listening.get(), 4) == 0);
  }
  ~Service() { std::filesystem::remove_all(directory); }
};

using Datagram = std::vector<std::byte>;

Datagram nextDatagram(FuzzInput& input, std::int32_t id) {
  const std::uint8_t how = input.byte();
  if (how % 4 == 3) {
    const auto bytes = input.bytes(input.byte());
    return {bytes.begin(), bytes.end()};
  }
  TelephonyPushReply reply{};
  reply.header = {kReplyDisposition, sizeof reply, 0, 1, 0, id + kReplyIdOffset};
  reply.ndr = kNdrRecord;
  reply.returnCode = static_cast<KernelReturn>((how & 0x10) != 0 ? input.number(4) : 0);
  reply.result = input.number((how & 0x20) != 0 ? 8 : 0);
  const auto whole = std::as_bytes(std::span(&reply, 1));
  Datagram bytes(whole.begin(), whole.end());
  if (how % 4 == 2) bytes.resize(offsetof(TelephonyPushReply, result));
  if ((how & 0x40) != 0) bytes.resize(input.byte() % 80);
  if ((how & 0x80) != 0 && !bytes.empty()) {
    const std::size_t at = input.byte() % bytes.size();
    bytes[at] = std::byte{input.byte()};
  }
  return bytes;
}

// The result that a datagram decides; nothing if it is out of turn.
std::optional<TelephonyResult> resultOf(const Datagram& bytes, std::int32_t id) {
  if (bytes.empty()) return telephonyResult(kPosixErrorDomain, EPIPE);  // taken for the end
  if (bytes.size() != 36 && bytes.size() != 44) return std::nullopt;
  const auto at = [&](std::size_t offset) {
    std::int32_t value;
    std::memcpy(&value, bytes.data() + offset, sizeof value);
    return value;
  };
  if (at(12) != 1 || at(20) != id + 100) return std::nullopt;
  if (at(32) != 0) return telephonyResult(kKernelErrorDomain, at(32));
  if (bytes.size() == 36) return telephonyResult(kPosixErrorDomain, EPROTO);
  std::uint64_t result;
  std::memcpy(&result, bytes.data() + 36, sizeof result);
  return TelephonyResult{result};
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const Service service;
  // Long enough for a busy machine; the end of the channel always comes first.
  static ChannelTelephonyDaemon daemon(service.directory, std::chrono::minutes(1));
  FuzzInput input(data, size);
  const bool isCivic = input.flag();
  const std::int32_t id = isCivic ? kSetCivicInfoMessageId : kSetLocalRoutableAddressMessageId;
  const std::string text(input.text());

  std::size_t outOfTurn = 0;
  const auto connection = daemon.create([&] { ++outOfTurn; });
  require(connection != nullptr);
  UniqueFd channel(::accept4(service.listening.get(), nullptr, nullptr, SOCK_CLOEXEC));
  require(channel.isValid());
  TelephonyResult expected = telephonyResult(kPosixErrorDomain, EPIPE);
  std::size_t expectedOutOfTurn = 0;
  bool isDecided = false;
  for (int i = 0; i < 8 && !input.isEmpty(); ++i) {
    const Datagram datagram = nextDatagram(input, id);
    const std::array parts{iovecOf(datagram)};
    require(sendDatagram(channel.get(), parts) == 0);
    const auto result = isDecided ? std::nullopt : resultOf(datagram, id);
    if (result) expected = *result;
    isDecided = isDecided || result.has_value();
    if (!isDecided) ++expectedOutOfTurn;
  }
  require(::shutdown(channel.get(), SHUT_WR) == 0);

  const TelephonyResult result = isCivic ? connection->setCivicInfoBasedOnCurrentLocation(text, {}, text, {})
                                         : connection->setLocalRoutableAddress(text);
  require(result == expected && outOfTurn == expectedOutOfTurn);
  // What was sent is one message, however long the text.
  std::array<std::byte, 2048> pushed;
  const ssize_t length = ::recv(channel.get(), pushed.data(), pushed.size(), MSG_DONTWAIT | MSG_TRUNC);
  require(length > static_cast<ssize_t>(sizeof(TelephonyPushMessage)));
  require(::recv(channel.get(), pushed.data(), pushed.size(), MSG_DONTWAIT) < 0);
  return 0;
}
