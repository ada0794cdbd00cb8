// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/network/linux/RemoteEchoNetwork.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/network/EchoMessages.h"
#include "platform/network/NetworkWork.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

// One conversation with the worker: a question and its answer at a time. What goes wrong ends it.
class Conversation {
 public:
  explicit Conversation(Worker& worker) noexcept : worker_(worker) {
    (void)worker.open(static_cast<std::uint32_t>(NetworkWork::echo), &channel_);  // else it is not open
  }

  bool tell(EchoMessageKind kind, std::vector<std::byte> payload) {
    if (!channel_.isOpen()) return false;
    return channel_.send({static_cast<std::uint32_t>(kind), std::move(payload), {}}) == WorkerResult::done;
  }

  // What `decode` makes of the answer, or nothing.
  template <typename Decode>
  auto ask(EchoMessageKind kind, std::vector<std::byte> payload, milliseconds patience, Decode decode)
      -> decltype(decode(std::span<const std::byte>())) {
    if (!tell(kind, std::move(payload))) return {};
    WorkerMessage answer;
    const auto result = channel_.receive(&answer, Clock::now() + patience);
    if (result == WorkerResult::done && answer.descriptors.empty()) {
      if (answer.kind == static_cast<std::uint32_t>(kind)) {
        if (auto decoded = decode(answer.payload)) return decoded;
      } else if (answer.kind == kRefusal) {
        channel_.close();
        return {};
      }
    }
    channel_.discard(&answer);
    if (result == WorkerResult::outOfMemory) {
      channel_.close();
    } else {
      worker_.giveUp(&channel_);
    }
    return {};
  }

 private:
  static constexpr auto kRefusal = static_cast<std::uint32_t>(EchoMessageKind::refusal);
  Worker& worker_;
  WorkerChannel channel_;
};

// One look-up, in a conversation of its own.
template <typename Decode>
auto lookUp(Worker& worker, EchoMessageKind kind, const char* name, milliseconds patience, Decode decode)
    -> decltype(decode(std::span<const std::byte>())) {
  if (std::strlen(name) > kLongestName) return {};
  return Conversation(worker).ask(kind, encodeName(name), patience, decode);
}

}  // namespace

class RemoteEchoNetwork::Socket final : public EchoSocket {
 public:
  Socket(Conversation conversation, EchoSocketForm form, milliseconds patience) noexcept
      : conversation_(std::move(conversation)), form_(form), patience_(patience) {}

  void setReceiveBufferSize(int bytes) override {
    tell(EchoMessageKind::setReceiveBufferSize, static_cast<std::uint32_t>(std::max(bytes, 0)));
  }
  void bindToInterface(unsigned index) override { tell(EchoMessageKind::bindToInterface, index); }

  int setReceiveTimeOut(std::chrono::microseconds timeOut) override {
    // Zero would be for ever.
    const auto microseconds = std::clamp<std::int64_t>(timeOut.count(), 1, UINT32_MAX);
    const auto error =
        conversation_.ask(EchoMessageKind::setReceiveTimeOut,
                          encodeNumber(static_cast<std::uint32_t>(microseconds)), patience_, decodeNumber);
    if (!error || !*error || **error > kLargestError) return EPIPE;
    timeOut_ = std::chrono::ceil<milliseconds>(std::chrono::microseconds(microseconds));
    return static_cast<int>(**error);
  }

  EchoTransfer sendTo(in_addr destination, std::span<const std::byte> message) override {
    if (message.size() > kLongestEcho) return {-1, EMSGSIZE};
    const auto answer = conversation_.ask(
        EchoMessageKind::sendTo, encodeSend(destination, message), patience_,
        [&](std::span<const std::byte> payload) { return decodeTransfer(payload, message.size()); });
    if (!answer) return {-1, EPIPE};
    return answer->transfer;
  }

  EchoTransfer receive(std::span<std::byte> buffer) override {
    const auto largest = std::min(buffer.size(), kLongestEcho);
    const auto answer = conversation_.ask(
        EchoMessageKind::receive, encodeNumber(static_cast<std::uint32_t>(largest)), timeOut_ + patience_,
        [&](std::span<const std::byte> payload) { return decodeTransfer(payload, largest); });
    if (!answer) return {-1, EPIPE};
    if (answer->transfer.count >= 0) std::copy(answer->bytes.begin(), answer->bytes.end(), buffer.begin());
    return {answer->transfer.count < 0 ? -1 : static_cast<std::ptrdiff_t>(answer->bytes.size()),
            answer->transfer.error};
  }

  bool deliversIpHeader() const noexcept override { return form_ == EchoSocketForm::withIpHeader; }

 private:
  static constexpr std::uint32_t kLargestError = 4095;

  void tell(EchoMessageKind kind, std::uint32_t number) {
    (void)conversation_.tell(kind, encodeNumber(number));  // as promised, nothing is told
  }

  Conversation conversation_;
  const EchoSocketForm form_;
  const milliseconds patience_;
  milliseconds timeOut_{0};
};

std::optional<in_addr> RemoteEchoNetwork::addressOfHost(const char* name) {
  const auto number = lookUp(worker_, EchoMessageKind::addressOfHost, name, kLookUpPatience, decodeNumber);
  if (!number || !*number) return std::nullopt;
  in_addr address{};
  address.s_addr = **number;
  return address;
}

std::optional<int> RemoteEchoNetwork::protocolByName(const char* name) {
  const auto number = lookUp(worker_, EchoMessageKind::protocolByName, name, patience_, decodeNumber);
  constexpr std::uint32_t kLargestProtocol = 255;
  if (!number || !*number || **number > kLargestProtocol) return std::nullopt;
  return static_cast<int>(**number);
}

unsigned RemoteEchoNetwork::indexOfInterface(const char* name) {
  const auto number = lookUp(worker_, EchoMessageKind::indexOfInterface, name, patience_, decodeNumber);
  return number ? number->value_or(0) : 0;
}

std::unique_ptr<EchoSocket> RemoteEchoNetwork::openEchoSocket(int protocol, std::uint16_t identifier) {
  Conversation conversation(worker_);
  const auto form = conversation.ask(EchoMessageKind::openSocket, encodeSocket(protocol, identifier),
                                     patience_, decodeForm);
  if (!form || *form == EchoSocketForm::none) return nullptr;
  return std::make_unique<Socket>(std::move(conversation), *form, patience_);
}

int RemoteEchoNetwork::timeOfDay(timeval* now) noexcept { return ::gettimeofday(now, nullptr); }

std::chrono::microseconds RemoteEchoNetwork::steadyTime() noexcept {
  return std::chrono::duration_cast<std::chrono::microseconds>(Clock::now().time_since_epoch());
}

}  // namespace brenvik
