// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/telephony/linux/ChannelTelephonyDaemon.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <new>
#include <span>
#include <utility>

#include "interface/TelephonyMessages.h"
#include "platform/base/Utf8.h"
#include "platform/datagram/Datagram.h"
#include "platform/datagram/Deadline.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/plist/PropertyList.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::microseconds;

// One request at a time travels on a connection, so any number but 0 tells its reply.
constexpr PortName kReplyNumber = 1;
constexpr std::size_t kRegionOffset = regionOffsetAfter(sizeof(TelephonyPushMessage));

TelephonyResult posixResult(int code) noexcept { return telephonyResult(kPosixErrorDomain, code); }

// A daemon that never stops talking is not listened to after the deadline.
int waitUntil(int fd, short events, Deadline deadline) noexcept {
  return deadline.hasPassed() ? ETIMEDOUT : waitFor(fd, events, deadline);
}

class ChannelConnection final : public TelephonyDaemonConnection {
 public:
  ChannelConnection(UniqueFd channel, Deadline deadline, PropertyList client, std::function<void()> callback)
      : channel_(std::move(channel)),
        deadline_(deadline),
        client_(std::move(client)),
        callback_(std::move(callback)) {}

  TelephonyResult setCivicInfoBasedOnCurrentLocation(
      const std::optional<std::string>& countryCode, const std::optional<std::string>& state,
      const std::optional<std::string>& city,
      const std::optional<std::string>& postalCode) noexcept override {
    const std::array<Value, 4> values{
        {{kCountryCodeKey, countryCode}, {kStateKey, state}, {kCityKey, city}, {kPostalCodeKey, postalCode}}};
    return push(kSetCivicInfoMessageId, values);
  }
  TelephonyResult setLocalRoutableAddress(const std::optional<std::string>& address) noexcept override {
    const std::array<Value, 1> values{{{kAddressKey, address}}};
    return push(kSetLocalRoutableAddressMessageId, values);
  }

 private:
  struct Value {
    const char* key;
    const std::optional<std::string>& text;
  };

  TelephonyResult push(std::int32_t id, std::span<const Value> values) noexcept try {
    std::vector<std::pair<std::string, PropertyList>> entries{{kClientKey, client_}};
    for (const Value& value : values) {
      if (!value.text) continue;
      PropertyList text = PropertyList::string(*value.text);
      // Without its text the push would say that nothing is known.
      if (!text && isValidUtf8(*value.text)) return posixResult(ENOMEM);
      entries.emplace_back(value.key, std::move(text));
    }
    const auto region =
        serializePropertyList(PropertyList::dictionary(std::move(entries)), PropertyListFormat::binary);
    if (!region) return posixResult(ENOMEM);
    if (const int code = send(id, *region); code != 0) return posixResult(code);
    return receiveReply(id + kReplyIdOffset);
  } catch (const std::bad_alloc&) {
    return posixResult(ENOMEM);
  }

  int send(std::int32_t id, std::string_view region) {
    TelephonyPushMessage message{};
    message.header.bits = kComplexBit | kReplyDisposition;
    message.header.size = sizeof message;
    message.header.replyPort = kReplyNumber;
    message.header.id = id;
    message.descriptorCount = 1;
    message.values.address = kRegionOffset;
    message.values.type = kOutOfLineDescriptorType;
    message.values.size = static_cast<std::uint32_t>(region.size());
    message.ndr = kNdrRecord;
    // A push is a few short texts: it always fits one datagram, and one that does not is no push of ours.
    if (region.size() > kLargestDatagram - kRegionOffset) return EMSGSIZE;
    constexpr std::array<std::byte, kRegionOffset - sizeof message> kPadding{};
    const std::array parts{iovecOf(std::as_bytes(std::span(&message, 1))), iovecOf(kPadding),
                           iovecOf(std::as_bytes(std::span(region)))};
    for (;;) {
      const int error = sendDatagram(channel_.get(), parts);
      if (error == ECONNRESET) return EPIPE;
      if (error != EAGAIN) return error;
      if (const int code = waitUntil(channel_.get(), POLLOUT, deadline_); code != 0) return code;
    }
  }

  TelephonyResult receiveReply(std::int32_t id) {
    for (;;) {
      if (const int code = waitUntil(channel_.get(), POLLIN, deadline_); code != 0) return posixResult(code);
      // Longer than any reply, so that a datagram cut to a reply's size is not taken for one. No room is
      // given for control data: the kernel drops the descriptors that nobody asked for.
      std::array<std::byte, 64> bytes;
      const iovec room{bytes.data(), bytes.size()};
      ReceivedDatagram received;
      const int error = receiveDatagram(channel_.get(), std::span(&room, 1), {}, {}, MSG_DONTWAIT, &received);
      if (error == EAGAIN || error == EINTR) continue;
      if (error == ECONNRESET || (error == 0 && received.length == 0)) return posixResult(EPIPE);
      if (error != 0) return posixResult(error);
      if (const auto result = resultIn(std::span(bytes).first(received.length), id)) return *result;
      if (callback_) callback_();
    }
  }

  // The result that the reply with this id carries; nothing when the bytes are no such reply.
  static std::optional<TelephonyResult> resultIn(std::span<const std::byte> bytes, std::int32_t id) noexcept {
    constexpr std::size_t kStatusOnly = offsetof(TelephonyPushReply, result);
    if (bytes.size() != sizeof(TelephonyPushReply) && bytes.size() != kStatusOnly) return std::nullopt;
    TelephonyPushReply reply{};
    std::memcpy(&reply, bytes.data(), bytes.size());
    if (reply.header.id != id || reply.header.localPort != kReplyNumber) return std::nullopt;
    if (reply.returnCode != kern::success) return telephonyResult(kKernelErrorDomain, reply.returnCode);
    // A bare status is how a message layer refuses; a success has to say what came of it.
    if (bytes.size() == kStatusOnly) return posixResult(EPROTO);
    return TelephonyResult{reply.result};
  }

  const UniqueFd channel_;
  const Deadline deadline_;
  const PropertyList client_;
  const std::function<void()> callback_;
};

}  // namespace

ChannelTelephonyDaemon::ChannelTelephonyDaemon(std::string bootstrapDirectory,
                                               std::chrono::milliseconds patience)
    : socketPath_(std::move(bootstrapDirectory) + "/" + kTelephonyServiceName), patience_(patience) {}

void ChannelTelephonyDaemon::addIdentifierException(std::string_view identifier) {
  const std::lock_guard lock(mutex_);
  if (std::find(identifiers_.begin(), identifiers_.end(), identifier) == identifiers_.end()) {
    identifiers_.emplace_back(identifier);
  }
}

std::unique_ptr<TelephonyDaemonConnection> ChannelTelephonyDaemon::create(
    std::function<void()> callback) noexcept try {
  const auto deadline = Clock::now() + patience_;
  const auto address = socketAddress(socketPath_);
  if (!address) return nullptr;
  UniqueFd channel = makeSocket(Blocking::yes);
  if (!channel.isValid()) return nullptr;
  // A daemon that hangs stops accepting, and a full backlog holds connect() up; a non-blocking one would fail
  // at once when the daemon is merely busy. The send time-out bounds the wait.
  for (;;) {
    const auto left = std::chrono::duration_cast<microseconds>(deadline - Clock::now());
    if (left.count() <= 0) return nullptr;  // and a zero time-out would mean none
    timeval timeOut{};
    timeOut.tv_sec = left.count() / 1'000'000;
    timeOut.tv_usec = left.count() % 1'000'000;
    if (::setsockopt(channel.get(), SOL_SOCKET, SO_SNDTIMEO, &timeOut, sizeof timeOut) != 0) return nullptr;
    if (connectSocket(channel.get(), *address) == 0) break;
    if (errno != EINTR) return nullptr;
  }

  std::vector<PropertyList> identifiers;
  {
    const std::lock_guard lock(mutex_);
    for (const auto& identifier : identifiers_) {
      identifiers.push_back(PropertyList::string(identifier));
      if (!identifiers.back()) return nullptr;
    }
  }
  PropertyList client = PropertyList::array(identifiers);
  if (!client) return nullptr;
  return std::make_unique<ChannelConnection>(std::move(channel), Deadline(deadline), std::move(client),
                                             std::move(callback));
} catch (const std::bad_alloc&) {
  return nullptr;
}

}  // namespace brenvik
