// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Client.h"

#include <poll.h>
#include <sched.h>
#include <sys/eventfd.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>

#include "platform/datagram/LocalSocket.h"

namespace brenvik::client {
namespace {

// How long a wait lasts that nobody can end early, because there was no descriptor to do it with.
constexpr int kDeafWait = 20;  // milliseconds

timeval timevalOf(std::chrono::milliseconds time) noexcept {
  return {time.count() / 1000, (time.count() % 1000) * 1000};
}

}  // namespace

Client::Client() noexcept {
  setTimeout(0);
  setSocket(nullptr);
}

void Client::setTimeout(std::uint32_t milliseconds) noexcept {
  timeout_ = std::chrono::milliseconds(milliseconds == 0 ? BVMH_DEFAULT_TIMEOUT_MS : milliseconds);
}

bool Client::setSocket(const char* path) noexcept {
  if (path == nullptr) path = bvmh_service_socket();
  const auto address = socketAddress(path);
  if (address) address_ = *address;
  return address.has_value();
}

std::int32_t Client::connect() noexcept {
  systemError_ = 0;
  if (takeInterruption()) return BVMH_ERROR_INTERRUPTED;
  if (channel_.isValid()) return BVMH_OK;
  const std::int32_t code = checkIn(Deadline::in(timeout_));
  wantsChannel_ = code == BVMH_OK;
  wasConnected_ = wantsChannel_;
  rearm();
  return code;
}

void Client::disconnect() noexcept {
  checkIn_.abandon();
  finishAll(calls_.sent(), BVMH_ERROR_ANSWER_LOST, 0);
  finishAll(calls_.waiting(), BVMH_ERROR_NOT_CONNECTED, 0);
  closeChannel();
  wantsChannel_ = false;
  wasConnected_ = false;
  rearm();
}

void Client::useChannel(CheckIn::Channel channel) noexcept {
  channel_ = std::move(channel.socket);
  deathWatch_ = std::move(channel.deathWatch);
  ++channelSerial_;
  channelNumber_ = channel_.get();
  armedTimeout_ = std::chrono::milliseconds(0);
  sentOnChannel_ = 0;
  unanswered_ = 0;
  sawReset_ = false;
}

PortName Client::nextReplyPort() noexcept {
  do ++lastReplyPort_;
  while (!isUsablePort(lastReplyPort_));
  ++sentOnChannel_;
  return lastReplyPort_;
}

MessageHeader Client::headerOf(const RoutineFacts& routine, PortName replyPort) const noexcept {
  return {(routine.descriptors == 0 ? 0 : kComplexBit) | kReplyDisposition,
          routine.requestSize,
          replyPort,
          kNullPort,
          0,
          routine.id};
}

std::int32_t Client::codeOf(Exchange outcome) const noexcept {
  switch (outcome) {
    case Exchange::answered:
      return BVMH_OK;
    case Exchange::notTaken:
      return BVMH_ERROR_HELPER_GONE;
    case Exchange::lost:
      return BVMH_ERROR_ANSWER_LOST;
    case Exchange::timedOut:
      return BVMH_ERROR_TIMED_OUT;
    case Exchange::broken:
      return BVMH_ERROR_PROTOCOL;
    case Exchange::noMemory:
      return BVMH_ERROR_NO_MEMORY;
    case Exchange::interrupted:
      return BVMH_ERROR_INTERRUPTED;
    case Exchange::failed:
      break;
  }
  return BVMH_ERROR_SYSTEM;
}

void Client::interrupt() noexcept {
  if (interrupted_) return;  // the thread that set it does the rest
  const int error = errno;
  ++interrupters_;  // keeps both descriptors from being closed
  interrupted_ = true;
  const int channel = channelNumber_;
  if (waitsOnChannel_ && channel >= 0) {
    wasCut_ = true;
    ::shutdown(channel, SHUT_RDWR);
  }
  const int wake = wakeNumber_;
  if (wake >= 0) {
    const std::uint64_t one = 1;
    // A full one is readable, too.
    [[maybe_unused]] const ssize_t written = ::write(wake, &one, sizeof one);
  }
  --interrupters_;
  errno = error;
}

bool Client::takeInterruption() noexcept {
  if (!interrupted_.load(std::memory_order_relaxed)) return false;
  while (interrupters_ != 0) ::sched_yield();
  interrupted_ = false;
  if (wasCut_) channelEnded();
  return true;
}

void Client::closeChannel() noexcept {
  if (!channel_.isValid()) return;
  channelNumber_ = -1;
  while (interrupters_ != 0) ::sched_yield();
  wasCut_ = false;
  rearm();  // Closing does not end the watch: the helper holds the same socket.
  channel_.reset();
  deathWatch_.reset();
}

void Client::waitForWork(Deadline deadline) noexcept {
  if (!wake_.isValid()) {
    wake_.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    wakeNumber_ = wake_.get();
  }
  std::array<pollfd, 2> entries{
      pollfd{channel_.isValid() ? channel_.get() : checkIn_.descriptor(), POLLIN, 0},
      pollfd{wake_.get(), POLLIN, 0}};
  if (channel_.isValid() && !calls_.waiting().empty()) entries[0].events |= POLLOUT;
  int time = std::min({deadline, earliest_, checkIn_.due()}).millisecondsForPoll();
  if (!wake_.isValid() && (time < 0 || time > kDeafWait)) time = kDeafWait;
  // From here on, interrupt() knows the descriptor.
  if (interrupted_) return;
  ::poll(entries.data(), entries.size(), time);  // the caller checks everything, whatever the result
  if (entries[1].revents != 0) {
    std::uint64_t count = 0;
    [[maybe_unused]] const ssize_t taken = ::read(wake_.get(), &count, sizeof count);
  }
}

std::int32_t Client::checkIn(Deadline deadline) noexcept {
  const auto givenUp = [this](std::int32_t code) {
    if (calls_.waiting().empty()) checkIn_.abandon();
    return code;
  };
  if (!checkIn_.isUnderWay()) checkIn_.start(address_);
  for (;;) {
    if (const auto code = checkIn_.advance()) {
      systemError_ = checkIn_.systemError();
      checkInEnded(*code);
      return *code;
    }
    if (deadline.hasPassed()) return givenUp(BVMH_ERROR_TIMED_OUT);
    if (takeInterruption()) return givenUp(BVMH_ERROR_INTERRUPTED);
    expire();
    waitForWork(deadline);
  }
}

Waiting Client::armSocketTimeout() noexcept {
  if (armedTimeout_ == timeout_) return Waiting::bySocketOption;
  const timeval time = timevalOf(timeout_);
  if (::setsockopt(channel_.get(), SOL_SOCKET, SO_RCVTIMEO, &time, sizeof time) != 0) return Waiting::byPoll;
  armedTimeout_ = timeout_;
  return Waiting::bySocketOption;
}

std::int32_t Client::call(const RoutineFacts& routine, std::span<std::byte> message, Regions regions,
                          bvmh_result* result) noexcept {
  systemError_ = 0;
  result->region = bvmh_region{};
  if (!wantsChannel_) return BVMH_ERROR_NOT_CONNECTED;
  if (takeInterruption()) return BVMH_ERROR_INTERRUPTED;
  if (!calls_.areFinished() || checkIn_.isUnderWay())
    return callAmongBegun(routine, message, regions, result);
  const Deadline deadline = Deadline::in(timeout_);

  Outgoing request;
  if (!request.lay(message, regions)) {
    systemError_ = errno;
    return BVMH_ERROR_SYSTEM;
  }
  for (bool hasCheckedIn = false;;) {
    if (!channel_.isValid()) {
      if (hasCheckedIn) return BVMH_ERROR_HELPER_GONE;
      if (const std::int32_t code = checkIn(deadline); code != BVMH_OK) return code;
      rearm();
      hasCheckedIn = true;
    }
    // A check-in has used up some of the time, which the socket option does not know.
    const Waiting waiting = hasCheckedIn ? Waiting::byPoll : armSocketTimeout();
    Reply reply;
    const Exchange outcome = exchangeAlone(routine, message, request, deadline, waiting, &reply);
    switch (outcome) {
      case Exchange::answered:
        return finishAlone(routine, reply, result);
      case Exchange::notTaken:
        closeChannel();
        continue;
      case Exchange::lost:
      case Exchange::broken:
        closeChannel();
        break;
      case Exchange::interrupted:
        (void)takeInterruption();
        break;
      case Exchange::timedOut:
      case Exchange::failed:
      case Exchange::noMemory:
        break;
    }
    return codeOf(outcome);
  }
}

Client::Exchange Client::exchangeAlone(const RoutineFacts& routine, std::span<std::byte> message,
                                       const Outgoing& request, Deadline deadline, Waiting waiting,
                                       Reply* reply) noexcept {
  const PortName replyPort = nextReplyPort();
  const MessageHeader header = headerOf(routine, replyPort);
  std::memcpy(message.data(), &header, sizeof header);
  waitsOnChannel_ = true;
  const Exchange outcome =
      interrupted_ ? Exchange::interrupted : exchange(routine, request, replyPort, deadline, waiting, reply);
  waitsOnChannel_.store(false, std::memory_order_release);
  return outcome != Exchange::answered && interrupted_ ? Exchange::interrupted : outcome;
}

std::int32_t Client::finishAlone(const RoutineFacts& routine, const Reply& reply,
                                 bvmh_result* result) noexcept {
  const std::int32_t code = reply.code == BVMH_OK ? readResult(routine, reply, result) : reply.code;
  if (incoming_.descriptorCount != 0) incoming_ = Incoming{};
  if (code == BVMH_ERROR_PROTOCOL) closeChannel();
  if (code == BVMH_OK && Questions::isQuestion(routine.id))
    questions_.asked(routine.id, 0, std::chrono::steady_clock::now());
  return code;
}

std::int32_t Client::callAmongBegun(const RoutineFacts& routine, std::span<const std::byte> message,
                                    Regions regions, bvmh_result* result) noexcept {
  BegunCall* const call = add(routine, message, regions, nullptr);
  if (call == nullptr) return BVMH_ERROR_NO_MEMORY;
  call->isBlocking = true;
  const bvmh_call number = call->result.call;
  for (;;) {
    settle();
    if (call->state == BegunCall::State::finished) {
      (void)takeResult(number, result);
      systemError_ = result->system_error;
      return result->code;
    }
    if (takeInterruption()) {
      (void)cancel(number);
      return BVMH_ERROR_INTERRUPTED;
    }
    waitForWork(Deadline::never());
  }
}

Client::Exchange Client::exchange(const RoutineFacts& routine, const Outgoing& request, PortName replyPort,
                                  Deadline deadline, Waiting waiting, Reply* reply) noexcept {
  if (!buffer_.ensure()) return Exchange::noMemory;
  switch (sendMessage(channel_.get(), request.parts(), request.descriptors(), deadline, &waiting)) {
    case Io::done:
      break;
    case Io::closed:
    case Io::reset:
      return Exchange::notTaken;
    case Io::timedOut:
      return Exchange::timedOut;
    case Io::failed:
      systemError_ = errno;
      return Exchange::failed;
  }
  const Exchange outcome = awaitReply(routine, replyPort, deadline, waiting, reply);
  if (outcome != Exchange::answered) incoming_ = Incoming{};
  if (outcome == Exchange::timedOut || outcome == Exchange::failed) ++unanswered_;
  return outcome;
}

Client::Exchange Client::awaitReply(const RoutineFacts& routine, PortName replyPort, Deadline deadline,
                                    Waiting waiting, Reply* reply) noexcept {
  for (;;) {
    switch (receiveMessage(channel_.get(), buffer_.bytes(), deadline, waiting, &incoming_)) {
      case Io::done:
        break;
      case Io::closed:
        return Exchange::lost;
      // The kernel says "reset" when the peer left messages unread, and ours is the last one sent.
      case Io::reset:
        return Exchange::notTaken;
      case Io::timedOut:
        return Exchange::timedOut;
      case Io::failed:
        systemError_ = errno;
        return Exchange::failed;
    }
    const std::span<const std::byte> datagram = std::as_bytes(buffer_.bytes()).first(incoming_.length);
    const auto answered = answeredPort(datagram);
    if (!answered) return Exchange::broken;
    if (*answered == replyPort) {
      return readReply(routine, datagram, &incoming_, reply) ? Exchange::answered : Exchange::broken;
    }
    if (!isLateAnswer(*answered, replyPort)) return Exchange::broken;
    if (deadline.hasPassed()) return Exchange::timedOut;
    waiting = Waiting::byPoll;
  }
}

// Whether a request of this channel with that number was given up and not answered since.
bool Client::isLateAnswer(PortName answered, PortName replyPort) noexcept {
  const PortName age = replyPort - answered;
  // Two numbers are left out each time round.
  if (unanswered_ == 0 || age >= sentOnChannel_ + (answered > replyPort ? 2 : 0)) return false;
  --unanswered_;
  return true;
}

std::int32_t Client::readResult(const RoutineFacts& routine, const Reply& reply,
                                bvmh_result* result) noexcept {
  const auto* const fields = reinterpret_cast<const char*>(reply.datagram.data()) + sizeof(StatusReply);
  const auto readText = [&](std::size_t fieldSize) {
    static_assert(sizeof result->text > sizeof(String256Reply::text));
    const std::size_t length = ::strnlen(fields, fieldSize);
    std::memcpy(result->text, fields, length);
    result->text[length] = '\0';
  };
  switch (routine.reply) {
    case ReplyForm::integer:
      // Only the first byte of the field means anything.
      result->boolean = fields[0] != 0;
      break;
    case ReplyForm::string64:
      readText(sizeof(String64Reply::text));
      break;
    case ReplyForm::string256:
      readText(sizeof(String256Reply::text));
      break;
    case ReplyForm::outOfLine:
      return takeRegion(reply.region, buffer_, incoming_, &result->region);
    case ReplyForm::status:
    case ReplyForm::checkIn:
      break;
  }
  return BVMH_OK;
}

}  // namespace brenvik::client
