// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/worker/WorkerChannel.h"

#include <poll.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <new>
#include <span>
#include <utility>

#include "platform/datagram/Datagram.h"
#include "platform/datagram/Deadline.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/ipc/linux/ClosingLine.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;

// What waits to be closed: descriptors of four messages at most, and channels that nobody reads any more.
constexpr std::size_t kMaxToClose = 4 * (kMaxDatagramDescriptors + 3);
constexpr std::size_t kRoomForChannels = 256;

// See docs/decisions/11-door.md. Never destroyed: a thread of it may be stuck at the end of the process.
ClosingLine& closingLine() {
  static ClosingLine* const line = new ClosingLine(kMaxToClose);
  return *line;
}

void closeElsewhere(UniqueFd descriptor) noexcept {
  try {
    closingLine().close(std::move(descriptor), ClosingLine::kClients);
  } catch (const std::bad_alloc&) {  // then here
  }
}

// What came with one message. Its destructor closes what was not handed over: elsewhere, where a distrusted
// peer may have sent it.
class Received {
 public:
  explicit Received(bool isDistrusted) noexcept : isDistrusted_(isDistrusted) {}
  Received(const Received&) = delete;
  Received& operator=(const Received&) = delete;
  ~Received() {
    for (UniqueFd& each : descriptors()) {
      if (isDistrusted_ && each.isValid()) closeElsewhere(std::move(each));
    }
  }
  bool isDistrusted() const noexcept { return isDistrusted_; }
  std::span<UniqueFd> descriptors() noexcept { return std::span(places).first(datagram.descriptorCount); }

  // For as many as one datagram can carry. So the kernel drops none in this thread, where the last close of a
  // foreign descriptor could wait.
  std::array<UniqueFd, kMaxDatagramDescriptors> places;
  ReceivedDatagram datagram;

 private:
  const bool isDistrusted_;
};

WorkerResult resultOfSending(int error) noexcept {
  switch (error) {
    case 0:
      return WorkerResult::done;
    case EAGAIN:
    case ETOOMANYREFS:  // descriptors on their way that nobody has taken
      return WorkerResult::full;
    case EPIPE:
    case ECONNRESET:
    case ENOTCONN:
    case ECONNREFUSED:
      return WorkerResult::closed;
    case ENOMEM:
    case ENOBUFS:
      return WorkerResult::outOfMemory;
    default:
      return WorkerResult::malformed;
  }
}

WorkerResult awaitDatagram(int socket, std::span<const iovec> pieces, Clock::time_point deadline,
                           Received* received) noexcept {
  ControlRoom<kMaxDatagramDescriptors> control;
  const bool forEver = deadline == Clock::time_point::max();
  int error = EAGAIN;
  while (error == EAGAIN || error == EINTR) {
    const int waited = forEver ? 0 : waitFor(socket, POLLIN, Deadline(deadline));
    if (waited != 0) return waited == ETIMEDOUT ? WorkerResult::timedOut : WorkerResult::outOfMemory;
    if (received->isDistrusted() && !WorkerChannel::hasRoomToDistrust()) return WorkerResult::unavailable;
    error = receiveDatagram(socket, pieces, control.bytes, received->places, forEver ? 0 : MSG_DONTWAIT,
                            &received->datagram);
  }
  if (error == 0) return WorkerResult::done;
  return error == ENOMEM || error == ENOBUFS ? WorkerResult::outOfMemory : WorkerResult::closed;
}

}  // namespace

bool WorkerChannel::hasRoomToDistrust() noexcept {
  try {
    return closingLine().hasRoomFor(kMaxDatagramDescriptors + kRoomForChannels);
  } catch (const std::bad_alloc&) {
    return false;
  }
}

WorkerChannel& WorkerChannel::operator=(WorkerChannel&& other) noexcept {
  close();
  socket_ = std::move(other.socket_);
  generation_ = other.generation_;
  isDistrusted_ = other.isDistrusted_;
  return *this;
}

void WorkerChannel::close() noexcept {
  if (!socket_.isValid()) return;
  if (isDistrusted_) {
    (void)::shutdown(socket_.get(), SHUT_RDWR);
    if (!isDrained(socket_.get())) closeElsewhere(std::move(socket_));
  }
  socket_.reset();
}

void WorkerChannel::discard(WorkerMessage* message) noexcept {
  for (UniqueFd& each : message->descriptors) {
    if (isDistrusted_) closeElsewhere(std::move(each));
  }
  message->descriptors.clear();
}

WorkerResult WorkerChannel::makePair(WorkerChannel* one, WorkerChannel* other) noexcept {
  UniqueFd first;
  UniqueFd second;
  if (makeSocketPair(&first, &second) != 0) return WorkerResult::outOfMemory;
  *one = WorkerChannel(std::move(first));
  *other = WorkerChannel(std::move(second));
  return WorkerResult::done;
}

WorkerResult WorkerChannel::send(const WorkerMessage& message) noexcept {
  if (!socket_.isValid()) return WorkerResult::closed;
  if (message.payload.size() > WorkerMessage::kLongestPayload ||
      message.descriptors.size() > WorkerMessage::kMaxDescriptors) {
    return WorkerResult::malformed;
  }
  std::array<int, WorkerMessage::kMaxDescriptors> descriptors{};
  std::transform(message.descriptors.begin(), message.descriptors.end(), descriptors.begin(),
                 [](const UniqueFd& each) { return each.get(); });
  const std::array pieces{iovecOf(std::as_bytes(std::span(&message.kind, 1))), iovecOf(message.payload)};
  return resultOfSending(
      sendDatagram(socket_.get(), pieces, std::span(descriptors).first(message.descriptors.size())));
}

WorkerResult WorkerChannel::receive(WorkerMessage* message, Clock::time_point deadline) noexcept {
  alignas(8) std::array<std::byte, WorkerMessage::kLongestPayload> room;  // written by the kernel only
  return receiveInto(room, message, deadline);
}

WorkerResult WorkerChannel::receiveShort(WorkerMessage* message, Clock::time_point deadline) noexcept {
  alignas(8) std::array<std::byte, WorkerMessage::kShortPayload> room;
  return receiveInto(room, message, deadline);
}

WorkerResult WorkerChannel::receiveInto(std::span<std::byte> bytes, WorkerMessage* message,
                                        Clock::time_point deadline) noexcept {
  message->kind = 0;
  message->payload.clear();
  message->descriptors.clear();
  if (!socket_.isValid()) return WorkerResult::closed;

  std::uint32_t kind = 0;
  const std::array<iovec, 2> pieces{{{&kind, sizeof kind}, {bytes.data(), bytes.size()}}};
  Received received(isDistrusted_);
  const WorkerResult waited = awaitDatagram(socket_.get(), pieces, deadline, &received);
  if (waited != WorkerResult::done) return waited;
  const auto& [length, count, areBytesCut, areDescriptorsCut, sender] = received.datagram;
  if (length == 0) return WorkerResult::closed;
  // There was room for all: what the kernel had to leave out found no free descriptor in this process.
  if (areDescriptorsCut && count <= WorkerMessage::kMaxDescriptors) return WorkerResult::outOfMemory;
  if (areBytesCut || areDescriptorsCut || length < sizeof kind || count > WorkerMessage::kMaxDescriptors)
    return WorkerResult::malformed;
  try {
    message->payload.assign(bytes.data(), bytes.data() + (length - sizeof kind));
    message->descriptors.reserve(count);
  } catch (const std::bad_alloc&) {
    message->payload.clear();
    return WorkerResult::outOfMemory;
  }
  for (UniqueFd& each : received.descriptors()) message->descriptors.push_back(std::move(each));
  message->kind = kind;
  return WorkerResult::done;
}

bool isChannelSocket(int fd) noexcept { return isLocalSocket(fd, Listening::no); }

}  // namespace brenvik
