// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/telephony/linux/ChannelTelephonyDaemon.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <new>
#include <span>
#include <utility>

#include "interface/TelephonyMessages.h"
#include "platform/base/UniqueFd.h"
#include "platform/base/Utf8.h"
#include "platform/plist/PropertyList.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::microseconds;

// One request at a time travels on a connection, so any number but 0 tells its reply.
constexpr PortName kReplyNumber = 1;
constexpr std::size_t kRegionOffset = (sizeof(TelephonyPushMessage) + 7) / 8 * 8;

TelephonyResult posixResult(int code) noexcept { return telephonyResult(kPosixErrorDomain, code); }

// Waits for `events` on the socket; 0, or ETIMEDOUT.
int waitFor(int fd, short events, Clock::time_point deadline) noexcept {
  for (;;) {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
    if (left.count() <= 0) return ETIMEDOUT;
    pollfd entry{fd, events, 0};
    const int ready = ::poll(&entry, 1, static_cast<int>(left.count()));
    if (ready > 0) return 0;
    if (ready < 0 && errno != EINTR) return errno;
  }
}

class ChannelConnection final : public TelephonyDaemonConnection {
 public:
  ChannelConnection(UniqueFd channel, Clock::time_point deadline, PropertyList client,
                    std::function<void()> callback)
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
    std::vector<char> datagram(kRegionOffset + region.size());
    std::memcpy(datagram.data(), &message, sizeof message);
    std::memcpy(datagram.data() + kRegionOffset, region.data(), region.size());
    for (;;) {
      if (::send(channel_.get(), datagram.data(), datagram.size(), MSG_DONTWAIT | MSG_NOSIGNAL) >= 0)
        return 0;
      if (errno == EINTR) continue;
      if (errno == ECONNRESET) return EPIPE;
      if (errno != EAGAIN) return errno;
      if (const int code = waitFor(channel_.get(), POLLOUT, deadline_); code != 0) return code;
    }
  }

  TelephonyResult receiveReply(std::int32_t id) {
    for (;;) {
      if (const int code = waitFor(channel_.get(), POLLIN, deadline_); code != 0) return posixResult(code);
      // Longer than any reply, so that a datagram cut to a reply's size is not taken for one. No room is
      // given for control data: the kernel drops the descriptors that nobody asked for.
      std::array<char, 64> bytes;
      const ssize_t size = ::recv(channel_.get(), bytes.data(), bytes.size(), MSG_DONTWAIT);
      if (size < 0 && (errno == EAGAIN || errno == EINTR)) continue;
      if (size == 0 || (size < 0 && errno == ECONNRESET)) return posixResult(EPIPE);
      if (size < 0) return posixResult(errno);
      if (const auto result = resultIn({bytes.data(), static_cast<std::size_t>(size)}, id)) return *result;
      if (callback_) callback_();
    }
  }

  // The result that the reply with this id carries; nothing when the bytes are no such reply.
  static std::optional<TelephonyResult> resultIn(std::span<const char> bytes, std::int32_t id) noexcept {
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
  const Clock::time_point deadline_;
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
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (socketPath_.size() >= sizeof address.sun_path) return nullptr;
  std::memcpy(address.sun_path, socketPath_.data(), socketPath_.size());

  UniqueFd channel(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
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
    if (::connect(channel.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) break;
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
  return std::make_unique<ChannelConnection>(std::move(channel), deadline, std::move(client),
                                             std::move(callback));
} catch (const std::bad_alloc&) {
  return nullptr;
}

}  // namespace brenvik
