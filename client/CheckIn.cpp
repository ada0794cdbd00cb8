// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/CheckIn.h"

#include <fcntl.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstddef>

#include "client/Outgoing.h"
#include "interface/Messages.h"
#include "platform/datagram/LocalSocket.h"

namespace brenvik::client {
namespace {

// Check-in is tried again after 1, 2, 4 ... 512 ms: about a second, the time a helper needs many times over
// to be started anew.
constexpr std::uint32_t kMaxTries = 11;

// A full backlog tells nobody when there is room again, so it is looked at every few milliseconds.
constexpr std::uint32_t kLongestKnockPause = 16;

// The errors of connect(2) that mean that nobody listens, rather than that we lack a resource.
bool meansNobody(int error) noexcept {
  switch (error) {
    case EMFILE:
    case ENFILE:
    case ENOMEM:
    case ENOBUFS:
    case EBADF:
    case EINVAL:
      return false;
    default:
      return true;
  }
}

Deadline inMilliseconds(std::uint32_t time) noexcept { return Deadline::in(std::chrono::milliseconds(time)); }

}  // namespace

void CheckIn::start(const sockaddr_un& address) noexcept {
  address_ = address;
  tries_ = 0;
  hadLeft_ = false;
  systemError_ = 0;
  channel_ = Channel{};
  step_ = Step::pause;
  due_ = inMilliseconds(0);
}

void CheckIn::abandon() noexcept {
  step_ = Step::none;
  due_ = Deadline::never();
  service_.reset();
  channel_ = Channel{};
}

std::int32_t CheckIn::systemFailure() noexcept {
  systemError_ = errno;
  return BVMH_ERROR_SYSTEM;
}

std::optional<std::int32_t> CheckIn::advance() noexcept {
  std::optional<std::int32_t> code;
  if (step_ == Step::pause && due_.hasPassed()) {
    ++tries_;
    knocks_ = 0;
    step_ = Step::connect;
  }
  if (step_ == Step::connect && (knocks_ == 0 || due_.hasPassed())) {
    code = connect();
  } else if (step_ == Step::awaitReply) {
    code = readAnswer();
  }
  if (!code) return std::nullopt;
  code = tryEnded(*code);
  if (!code) return std::nullopt;
  step_ = Step::none;
  due_ = Deadline::never();
  if (*code == BVMH_OK) systemError_ = 0;
  if (*code != BVMH_OK) channel_ = Channel{};
  return code;
}

std::optional<std::int32_t> CheckIn::tryEnded(std::int32_t code) noexcept {
  service_.reset();
  if (code == BVMH_OK) return code;
  // A helper that stops closes what it has not answered; asking again may start it anew. Its socket may be
  // missing for a moment then, which says nothing at the first try but that there is no helper.
  const bool hasLeft = code == BVMH_ERROR_HELPER_GONE;
  const bool isBetweenLives = hadLeft_ && code == BVMH_ERROR_UNREACHABLE;
  if ((!hasLeft && !isBetweenLives) || tries_ == kMaxTries) return code;
  hadLeft_ = true;
  channel_ = Channel{};
  step_ = Step::pause;
  due_ = inMilliseconds(1U << (tries_ - 1));
  return std::nullopt;
}

std::optional<std::int32_t> CheckIn::connect() noexcept {
  service_ = makeSocket(Blocking::no);
  if (!service_.isValid()) return systemFailure();
  ++serial_;
  int result = 0;
  do result = connectSocket(service_.get(), address_);
  while (result != 0 && errno == EINTR);
  if (result == 0) return ask();
  if (errno == EAGAIN) {
    service_.reset();
    due_ = inMilliseconds(std::min(1U << std::min(knocks_, 8U), kLongestKnockPause));
    ++knocks_;
    return std::nullopt;
  }
  systemError_ = errno;
  // The socket is the group's; who is not in it is refused before the helper could.
  if (systemError_ == EACCES) return BVMH_INVALID_SECURITY;
  return meansNobody(systemError_) ? BVMH_ERROR_UNREACHABLE : BVMH_ERROR_SYSTEM;
}

std::optional<std::int32_t> CheckIn::ask() noexcept {
  UniqueFd given;
  if (makeSocketPair(&channel_.deathWatch, &given) != 0) return systemFailure();

  CheckInRequest request{};
  request.header = {kComplexBit | kReplyDisposition, sizeof request, tries_, 0, 0, kCheckInRoutine.id};
  request.descriptorCount = 1;
  request.clientPort.disposition = kDispositionMoveSend;
  request.clientPort.type = kPortDescriptorType;
  const std::array parts{iovecOf(std::as_bytes(std::span(&request, 1)))};
  const std::array descriptors{given.get()};
  Waiting waiting = Waiting::never;
  switch (sendMessage(service_.get(), parts, descriptors, Deadline::never(), &waiting)) {
    case Io::done:
      break;
    case Io::closed:
    case Io::reset:
      return BVMH_ERROR_HELPER_GONE;
    case Io::timedOut:  // a socket that was just made has room
    case Io::failed:
      return systemFailure();
  }
  step_ = Step::awaitReply;
  due_ = Deadline::never();
  return readAnswer();
}

std::optional<std::int32_t> CheckIn::readAnswer() noexcept {
  // A byte more than any answer, so that a longer one is seen.
  std::array<std::byte, sizeof(CheckInReply) + 1> buffer;
  Incoming incoming;
  switch (receiveMessage(service_.get(), buffer, Deadline::never(), Waiting::never, &incoming)) {
    case Io::done:
      break;
    case Io::timedOut:
      return std::nullopt;
    // Asking twice does no harm, so a helper that read the question and left counts like one that did not.
    case Io::closed:
    case Io::reset:
      return BVMH_ERROR_HELPER_GONE;
    case Io::failed:
      return systemFailure();
  }
  const std::span<const std::byte> datagram = std::span(buffer).first(incoming.length);
  Reply reply;
  if (answeredPort(datagram) != tries_ || !readReply(kCheckInRoutine, datagram, &incoming, &reply))
    return BVMH_ERROR_PROTOCOL;
  if (reply.code != BVMH_OK) return reply.code;

  // The helper may have made the pair for its own use, not blocking; waiting in recvmsg saves us a poll.
  const int flags = ::fcntl(reply.port.get(), F_GETFL);
  if (flags >= 0 && (flags & O_NONBLOCK) != 0) (void)::fcntl(reply.port.get(), F_SETFL, flags & ~O_NONBLOCK);
  channel_.socket = std::move(reply.port);
  return BVMH_OK;
}

}  // namespace brenvik::client
