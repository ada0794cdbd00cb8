// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Client.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>

namespace brenvik::client {
namespace {

// Check-in is tried again after 1, 2, 4 ... 512 ms: about a second, the time a helper needs many times over
// to be started anew.
constexpr int kMostTries = 11;

constexpr std::size_t kMostRegions = 2;
constexpr std::array<std::byte, 7> kPadding{};

timeval timevalOf(std::chrono::milliseconds time) noexcept {
  return {time.count() / 1000, (time.count() % 1000) * 1000};
}

iovec iovecOf(std::span<const std::byte> bytes) noexcept {
  return {const_cast<std::byte*>(bytes.data()), bytes.size()};  // for sending, which only reads
}

// connect(2) waits for room in a full backlog as long as SO_SNDTIMEO allows.
Io connectTo(int socket, const sockaddr_un& address, Deadline deadline) noexcept {
  for (;;) {
    const timeval left = timevalOf(std::chrono::milliseconds(std::max(deadline.millisecondsForPoll(), 1)));
    if (::setsockopt(socket, SOL_SOCKET, SO_SNDTIMEO, &left, sizeof left) != 0) return Io::failed;
    if (::connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) return Io::done;
    if (errno != EINTR && errno != EAGAIN) return Io::failed;
    if (deadline.hasPassed()) return Io::timedOut;
  }
}

// What connect says when there is nobody, and no resource of ours is short.
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
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  const std::size_t length = std::strlen(path);
  if (length == 0 || length >= sizeof address.sun_path) return false;
  std::memcpy(address.sun_path, path, length);
  address_ = address;
  return true;
}

std::int32_t Client::connect() noexcept {
  systemError_ = 0;
  if (channel_.isValid()) return BVMH_OK;
  const std::int32_t code = checkIn(Deadline::in(timeout_));
  wantsChannel_ = code == BVMH_OK;
  return code;
}

void Client::disconnect() noexcept {
  closeChannel();
  wantsChannel_ = false;
}

void Client::closeChannel() noexcept {
  channel_.reset();
  deathWatch_.reset();
}

PortName Client::nextReplyPort() noexcept {
  do ++lastReplyPort_;
  while (!isUsablePort(lastReplyPort_));
  return lastReplyPort_;
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
    case Exchange::failed:
      break;
  }
  return BVMH_ERROR_SYSTEM;
}

std::int32_t Client::checkIn(Deadline deadline) noexcept {
  bool hadLeft = false;
  for (int tries = 1;; ++tries) {
    UniqueFd channel;
    const std::int32_t code = tryCheckIn(deadline, &channel);
    if (code == BVMH_OK) {
      channel_ = std::move(channel);
      systemError_ = 0;
      armedTimeout_ = std::chrono::milliseconds(0);
      sentOnChannel_ = 0;
      unanswered_ = 0;
      return code;
    }
    deathWatch_.reset();
    // A helper that stops closes what it has not answered; asking again may start it anew. Its socket may be
    // missing for a moment then, which says nothing at the first try but that there is no helper.
    const bool hasLeft = code == BVMH_ERROR_HELPER_GONE;
    const bool isBetweenLives = hadLeft && code == BVMH_ERROR_UNREACHABLE;
    if (!hasLeft && !isBetweenLives) return code;
    hadLeft = true;
    if (tries == kMostTries) return code;
    const int left = deadline.millisecondsForPoll();
    if (left == 0) return code;
    ::poll(nullptr, 0, std::min(1 << (tries - 1), left));
  }
}

std::int32_t Client::tryCheckIn(Deadline deadline, UniqueFd* channel) noexcept {
  const auto systemFailure = [this] {
    systemError_ = errno;
    return BVMH_ERROR_SYSTEM;
  };
  UniqueFd service(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  if (!service.isValid()) return systemFailure();
  switch (connectTo(service.get(), address_, deadline)) {
    case Io::done:
      break;
    case Io::timedOut:
      return BVMH_ERROR_TIMED_OUT;
    default:
      systemError_ = errno;
      // The socket is the group's; who is not in it is refused before the helper could.
      if (systemError_ == EACCES) return BVMH_INVALID_SECURITY;
      return meansNobody(systemError_) ? BVMH_ERROR_UNREACHABLE : BVMH_ERROR_SYSTEM;
  }

  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0) return systemFailure();
  deathWatch_.reset(ends[0]);
  const UniqueFd given(ends[1]);

  CheckInRequest request{};
  request.header = {
      kComplexBit | kReplyDisposition, sizeof request, nextReplyPort(), 0, 0, kCheckInRoutine.id};
  request.descriptorCount = 1;
  request.clientPort.disposition = kDispositionMoveSend;
  request.clientPort.type = kPortDescriptorType;
  const std::array parts{iovecOf(std::as_bytes(std::span(&request, 1)))};
  const std::array descriptors{given.get()};
  Reply reply;
  const Exchange outcome = exchange(service.get(), kCheckInRoutine, parts, descriptors,
                                    request.header.replyPort, deadline, Waiting::byPoll, &reply);
  // Asking twice does no harm, so a helper that read the question and left counts like one that did not.
  if (outcome == Exchange::lost) return BVMH_ERROR_HELPER_GONE;
  if (outcome != Exchange::answered) return codeOf(outcome);
  if (reply.code != BVMH_OK) return reply.code;

  // The helper may have made the pair for its own use, not blocking; waiting in recvmsg saves us a poll.
  const int flags = ::fcntl(reply.port.get(), F_GETFL);
  if (flags >= 0 && (flags & O_NONBLOCK) != 0) (void)::fcntl(reply.port.get(), F_SETFL, flags & ~O_NONBLOCK);
  *channel = std::move(reply.port);
  return BVMH_OK;
}

Waiting Client::armSocketTimeout() noexcept {
  if (armedTimeout_ == timeout_) return Waiting::bySocketOption;
  const timeval time = timevalOf(timeout_);
  if (::setsockopt(channel_.get(), SOL_SOCKET, SO_RCVTIMEO, &time, sizeof time) != 0) return Waiting::byPoll;
  armedTimeout_ = timeout_;
  return Waiting::bySocketOption;
}

std::int32_t Client::call(const RoutineFacts& routine, std::span<std::byte> message,
                          std::span<const std::span<const std::byte>> regions, Reply* reply) noexcept {
  systemError_ = 0;
  if (!wantsChannel_) return BVMH_ERROR_NOT_CONNECTED;
  const Deadline deadline = Deadline::in(timeout_);

  // Regions follow the message in the datagram while they fit, each at a multiple of 8; the rest are memfds.
  std::array<iovec, 1 + 2 * kMostRegions> parts;
  std::size_t partCount = 0;
  parts[partCount++] = iovecOf(message);
  std::array<UniqueFd, kMostRegions> memories;
  std::array<int, kMostRegions> descriptors{};
  std::size_t descriptorCount = 0;
  std::size_t end = message.size();
  for (std::size_t i = 0; i < regions.size(); ++i) {
    OutOfLineDescriptor descriptor{};
    descriptor.type = kOutOfLineDescriptorType;
    descriptor.copy = kVirtualCopy;
    descriptor.size = static_cast<std::uint32_t>(regions[i].size());
    const std::size_t offset = roundUpTo8(end);
    if (regions[i].size() > kLargestDatagram - offset) {
      memories[i] = makeSealedMemory(regions[i]);
      if (!memories[i].isValid()) {
        systemError_ = errno;
        return BVMH_ERROR_SYSTEM;
      }
      descriptors[descriptorCount++] = memories[i].get();
    } else if (!regions[i].empty()) {
      descriptor.address = offset;
      if (offset != end) parts[partCount++] = iovecOf(std::span(kPadding).first(offset - end));
      parts[partCount++] = iovecOf(regions[i]);
      end = offset + regions[i].size();
    }
    std::memcpy(message.data() + kDescriptorsOffset + i * sizeof descriptor, &descriptor, sizeof descriptor);
  }

  for (bool hasCheckedIn = false;;) {
    if (!channel_.isValid()) {
      if (hasCheckedIn) return BVMH_ERROR_HELPER_GONE;
      if (const std::int32_t code = checkIn(deadline); code != BVMH_OK) return code;
      hasCheckedIn = true;
    }
    // A check-in has used up some of the time, which the socket option does not know.
    const Waiting waiting = hasCheckedIn ? Waiting::byPoll : armSocketTimeout();
    const MessageHeader header{(regions.empty() ? 0 : kComplexBit) | kReplyDisposition,
                               static_cast<std::uint32_t>(message.size()),
                               nextReplyPort(),
                               kNullPort,
                               0,
                               routine.id};
    std::memcpy(message.data(), &header, sizeof header);
    ++sentOnChannel_;
    const Exchange outcome =
        exchange(channel_.get(), routine, std::span(parts).first(partCount),
                 std::span(descriptors).first(descriptorCount), header.replyPort, deadline, waiting, reply);
    switch (outcome) {
      case Exchange::answered:
        return reply->code;
      case Exchange::notTaken:
        closeChannel();
        continue;
      case Exchange::lost:
      case Exchange::broken:
        closeChannel();
        break;
      case Exchange::timedOut:
      case Exchange::failed:
      case Exchange::noMemory:
        break;
    }
    return codeOf(outcome);
  }
}

Client::Exchange Client::exchange(int socket, const RoutineFacts& routine, std::span<const iovec> parts,
                                  std::span<const int> descriptors, PortName replyPort, Deadline deadline,
                                  Waiting waiting, Reply* reply) noexcept {
  if (!buffer_.ensure()) return Exchange::noMemory;
  switch (sendMessage(socket, parts, descriptors, deadline, &waiting)) {
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
  const Exchange outcome = awaitReply(socket, routine, replyPort, deadline, waiting, reply);
  if (outcome != Exchange::answered) incoming_ = Incoming{};
  if (outcome == Exchange::timedOut || outcome == Exchange::failed) ++unanswered_;
  return outcome;
}

Client::Exchange Client::awaitReply(int socket, const RoutineFacts& routine, PortName replyPort,
                                    Deadline deadline, Waiting waiting, Reply* reply) noexcept {
  for (;;) {
    switch (receiveMessage(socket, buffer_.bytes(), deadline, waiting, &incoming_)) {
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

std::int32_t Client::takeRegion(const Reply& reply, bvmh_region* region) noexcept {
  const std::int32_t code = client::takeRegion(reply.region, buffer_, incoming_, region);
  incoming_ = Incoming{};
  if (code == BVMH_ERROR_PROTOCOL) closeChannel();
  return code;
}

}  // namespace brenvik::client
