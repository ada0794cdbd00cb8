// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "workers/network/NetworkServing.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <functional>
#include <mutex>
#include <new>
#include <optional>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/datagram/SealedMemory.h"
#include "platform/network/EchoMessages.h"
#include "platform/network/GeoMessages.h"
#include "platform/network/GunzipMessages.h"
#include "platform/network/NetworkWork.h"
#include "platform/network/WebMessages.h"
#include "platform/network/linux/LargeMessage.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;

// A channel's question is sent together with it.
constexpr std::chrono::seconds kMaxQuestionTime{10};

// The question's message; nothing when none comes.
std::optional<WorkerMessage> questionOn(WorkerChannel& channel) {
  WorkerMessage message;
  if (channel.receive(&message, Clock::now() + kMaxQuestionTime) != WorkerResult::done ||
      message.kind != static_cast<std::uint32_t>(NetworkMessage::ask)) {
    return std::nullopt;
  }
  return message;
}

WorkerResult answer(WorkerChannel& channel, std::vector<std::byte> payload,
                    std::vector<UniqueFd> descriptors = {}) {
  return channel.send(packLarge(static_cast<std::uint32_t>(NetworkMessage::answer), std::move(payload),
                                std::move(descriptors)));
}

// False when the helper has hung up.
bool sayAlive(WorkerChannel& channel) {
  return channel.send({static_cast<std::uint32_t>(NetworkMessage::alive), {}, {}}) != WorkerResult::closed;
}

// One answer that comes on another thread, for the thread that serves the channel.
template <typename Answer>
class Expected {
 public:
  Expected() {
    if (!come_.isValid()) throw std::bad_alloc();
  }
  // Any thread, once.
  void set(Answer answer) {
    const std::lock_guard lock(mutex_);
    answer_.emplace(std::move(answer));
    (void)::eventfd_write(come_.get(), 1);  // its count is far from full
  }
  // Waits, and says meanwhile that it is at work. Nothing when the helper hangs up first.
  std::optional<Answer> wait(WorkerChannel& channel) {
    for (;;) {
      pollfd waited[] = {{come_.get(), POLLIN, 0}, {channel.descriptor(), POLLIN, 0}};
      const auto interval = std::chrono::duration_cast<std::chrono::milliseconds>(kAliveInterval).count();
      const int ready = ::poll(waited, 2, static_cast<int>(interval));
      if (ready < 0 && errno == EINTR) continue;
      if (ready < 0) return std::nullopt;
      if (waited[0].revents != 0) {
        const std::lock_guard lock(mutex_);
        return std::move(answer_);
      }
      // The helper has nothing more to say but that it has gone.
      if (waited[1].revents != 0 || !sayAlive(channel)) return std::nullopt;
    }
  }

 private:
  const UniqueFd come_{::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)};
  std::mutex mutex_;
  std::optional<Answer> answer_;
};

// The echo questions of one channel, which may have one socket open between them.
class EchoConversation {
 public:
  EchoConversation(EchoNetwork& network, WorkerChannel& channel) noexcept
      : network_(network), channel_(channel) {}

  // Does what is asked, and answers where an answer is due. False for what is no question, and when nobody
  // waits for the answer.
  bool answer(const WorkerMessage& question) {
    switch (static_cast<EchoMessageKind>(question.kind)) {
      case EchoMessageKind::addressOfHost:
        return lookUp(question, [this](const char* host) -> std::optional<std::uint32_t> {
          const auto address = network_.addressOfHost(host);
          return address ? std::optional(address->s_addr) : std::nullopt;
        });
      case EchoMessageKind::protocolByName:
        return lookUp(question, [this](const char* protocol) -> std::optional<std::uint32_t> {
          const auto found = network_.protocolByName(protocol);
          return found ? std::optional(static_cast<std::uint32_t>(*found)) : std::nullopt;
        });
      case EchoMessageKind::indexOfInterface:
        return lookUp(question, [this](const char* interface) -> std::optional<std::uint32_t> {
          return network_.indexOfInterface(interface);
        });
      case EchoMessageKind::openSocket:
        return openSocket(question);
      case EchoMessageKind::setReceiveBufferSize:
        return set(question, [this](std::uint32_t bytes) {
          socket_->setReceiveBufferSize(static_cast<int>(std::min<std::uint32_t>(bytes, INT32_MAX)));
        });
      case EchoMessageKind::bindToInterface:
        return set(question, [this](std::uint32_t index) { socket_->bindToInterface(index); });
      case EchoMessageKind::setReceiveTimeOut:
        return setReceiveTimeOut(question);
      case EchoMessageKind::sendTo:
        return sendTo(question);
      case EchoMessageKind::receive:
        return receive(question);
      case EchoMessageKind::refusal:
        break;
    }
    return false;
  }

 private:
  bool reply(const WorkerMessage& question, std::vector<std::byte> payload) {
    return channel_.send({question.kind, std::move(payload), {}}) == WorkerResult::done;
  }
  template <class LookUp>
  bool lookUp(const WorkerMessage& question, LookUp numberOf) {
    const auto name = decodeName(question.payload);
    return name && reply(question, encodeNumber(numberOf(name->c_str())));
  }
  // The number in a question that needs a socket.
  std::optional<std::uint32_t> numberIn(const WorkerMessage& question) const {
    const auto decoded = decodeNumber(question.payload);
    return decoded && socket_ != nullptr ? *decoded : std::nullopt;
  }
  template <class Set>
  bool set(const WorkerMessage& question, Set setTo) {
    const auto number = numberIn(question);
    if (number) setTo(*number);
    return number.has_value();
  }
  bool openSocket(const WorkerMessage& question) {
    const auto asked = decodeSocket(question.payload);
    if (!asked) return false;
    socket_ = network_.openEchoSocket(asked->protocol, asked->identifier);
    return reply(question, encode(socket_ == nullptr            ? EchoSocketForm::none
                                  : socket_->deliversIpHeader() ? EchoSocketForm::withIpHeader
                                                                : EchoSocketForm::withoutIpHeader));
  }
  bool setReceiveTimeOut(const WorkerMessage& question) {
    const auto timeOut = numberIn(question);
    if (!timeOut) return false;
    const int error =
        socket_->setReceiveTimeOut(std::chrono::microseconds(std::max<std::uint32_t>(*timeOut, 1)));
    return reply(question, encodeNumber(static_cast<std::uint32_t>(error)));
  }
  bool sendTo(const WorkerMessage& question) {
    const auto asked = decodeSend(question.payload);
    return asked && socket_ != nullptr &&
           reply(question, encodeTransfer(socket_->sendTo(asked->destination, asked->message), {}));
  }
  bool receive(const WorkerMessage& question) {
    const auto largest = numberIn(question);
    if (!largest || *largest > kLongestEcho) return false;
    std::array<std::byte, kLongestEcho> buffer;
    const auto received = socket_->receive(std::span(buffer).first(*largest));
    const auto size = static_cast<std::size_t>(std::max<std::ptrdiff_t>(received.count, 0));
    return reply(question, encodeTransfer(received, std::span(buffer).first(size)));
  }

  EchoNetwork& network_;
  WorkerChannel& channel_;
  std::unique_ptr<EchoSocket> socket_;
};

}  // namespace

NetworkServing::NetworkServing(const Parts& parts)
    : parts_(parts), answers_(parts.queues.makeSerial("answers", QualityOfService::standard)) {}

void NetworkServing::start(std::uint32_t work, WorkerChannel channel) noexcept {
  if (served_.fetch_add(1) < kMaxChannels) {
    try {
      auto shared = std::make_shared<WorkerChannel>(std::move(channel));
      try {
        std::thread([this, work, shared] {
          serve(work, std::move(*shared));
          served_.fetch_sub(1);
          served_.notify_all();
        }).detach();
        return;
      } catch (const std::exception&) {  // no thread or no memory
        channel = std::move(*shared);
      }
    } catch (const std::bad_alloc&) {  // as below
    }
  }
  served_.fetch_sub(1);
  const auto refusal = work == static_cast<std::uint32_t>(NetworkWork::echo)
                           ? static_cast<std::uint32_t>(EchoMessageKind::refusal)
                           : static_cast<std::uint32_t>(NetworkMessage::refusal);
  (void)channel.send({refusal, {}, {}});  // it closes in any case
}

void NetworkServing::waitUntilIdle() const noexcept {
  for (int served = served_.load(); served > 0; served = served_.load()) served_.wait(served);
}

void NetworkServing::serve(std::uint32_t work, WorkerChannel channel) noexcept {
  auto refusal = static_cast<std::uint32_t>(NetworkMessage::refusal);
  try {
    switch (static_cast<NetworkWork>(work)) {
      case NetworkWork::web:
        return serveWeb(channel);
      case NetworkWork::gunzip:
        return serveGunzip(channel);
      case NetworkWork::reverseGeocode:
        return serveReverseGeocode(channel);
      case NetworkWork::publicAddress:
        return servePublicAddress(channel);
      case NetworkWork::echo:
        refusal = static_cast<std::uint32_t>(EchoMessageKind::refusal);
        return serveEcho(channel);
    }
    return;                          // work that nobody here knows
  } catch (const std::exception&) {  // no memory, thread or descriptor
  }
  (void)channel.send({refusal, {}, {}});  // it closes in any case
}

void NetworkServing::serveWeb(WorkerChannel& channel) {
  auto message = questionOn(channel);
  if (!message) return;
  const auto opened = LargePayload::open(*std::move(message));
  if (!opened) return;
  const auto question = decodeWebQuestion(opened->bytes());
  if (!question) return;

  auto expected = std::make_shared<Expected<std::shared_ptr<WebResponse>>>();
  const auto session = parts_.web.makeSession();
  session->setCellularAllowed(question->cellularAllowed);
  const auto request = parts_.web.makeRequest(question->type, question->url, question->headers, session);
  if (request == nullptr) {
    (void)answer(channel, encode(WebAnswer{WebErrorKind::unusableUrl, 0, {}, 0}));  // or nobody waits for it
    return;
  }
  request->setTimeLimit(question->timeLimit);
  request->setLargestBody(question->largestBody);
  request->setCallbackQueue(answers_);
  request->setCompletion(
      [expected](std::shared_ptr<WebResponse> response) { expected->set(std::move(response)); });
  request->send({});
  const auto response = expected->wait(channel);
  if (!response) return request->cancel();
  WebAnswer told;
  std::vector<UniqueFd> descriptors;
  if (*response != nullptr) {
    told = {(*response)->errorKind, (*response)->statusCode, std::move((*response)->headers),
            (*response)->body.size()};
    if (told.bodySize > 0) {
      descriptors.push_back((*response)->body.takeSealed());
      if (!descriptors[0].isValid()) throw std::bad_alloc();
    }
  }
  (void)answer(channel, encode(told), std::move(descriptors));  // or nobody waits for it
}

void NetworkServing::serveGunzip(WorkerChannel& channel) {
  const auto message = questionOn(channel);
  if (!message || message->descriptors.size() != 2) return;
  const auto question = decodeGunzipQuestion(message->payload);
  if (!question) return;
  SealedMemory input;
  const int mapped = SealedMemory::map(message->descriptors[0].get(), question->inputSize, &input);
  if (mapped == EBADMSG) return;
  if (mapped != 0) throw std::bad_alloc();
  bool isWanted = true;
  auto told = Clock::now();
  const auto outcome = gunzip_.gunzipInto({input.bytes()}, message->descriptors[1].get(), question->room,
                                          question->largestOutput, [&] {
                                            const auto now = Clock::now();
                                            if (now - told < kAliveInterval) return true;
                                            told = now;
                                            isWanted = sayAlive(channel);
                                            return isWanted;
                                          });
  if (!isWanted) return;
  (void)channel.send(
      {static_cast<std::uint32_t>(NetworkMessage::answer), encode(outcome), {}});  // or nobody waits
}

void NetworkServing::serveReverseGeocode(WorkerChannel& channel) {
  const auto message = questionOn(channel);
  if (!message) return;
  const auto coordinate = decodeCoordinate(message->payload);
  if (!coordinate) return;
  auto expected = std::make_shared<Expected<GeoOutcome<MapItems>>>();
  parts_.geo.makeReverseGeocodeTicket(*coordinate, IncludeEta::no, ShiftLocations::ifNeeded, nullptr)
      ->submit(
          [expected](const std::optional<MapItems>& items, const std::optional<GeoError>& error) {
            expected->set({items, error});
          },
          nullptr, answers_);
  if (const auto outcome = expected->wait(channel))
    (void)answer(channel, encode(*outcome));  // or nobody waits for it
}

void NetworkServing::servePublicAddress(WorkerChannel& channel) {
  const auto message = questionOn(channel);
  if (!message || !message->payload.empty()) return;
  auto expected = std::make_shared<Expected<GeoOutcome<GeoIpResult>>>();
  parts_.geo.makeGeoIpTicket(std::nullopt)
      ->submit(
          [expected](const std::optional<GeoIpResult>& result, const std::optional<GeoError>& error) {
            expected->set({result, error});
          },
          nullptr, nullptr, answers_);
  if (const auto outcome = expected->wait(channel))
    (void)answer(channel, encode(*outcome));  // or nobody waits for it
}

// Each question is answered before the next one is read; one that is no question ends the conversation.
void NetworkServing::serveEcho(WorkerChannel& channel) {
  EchoConversation conversation(parts_.echo, channel);
  WorkerMessage question;
  while (channel.receive(&question, Clock::time_point::max()) == WorkerResult::done &&
         conversation.answer(question)) {
  }
}

}  // namespace brenvik
