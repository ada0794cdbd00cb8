// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/worker/WorkerChannel.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstring>
#include <new>
#include <span>
#include <utility>

#include "platform/ipc/linux/ClosingLine.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;

// As many as one message can carry on Linux (SCM_MAX_FD). With room for all of them none is dropped by the
// kernel in this thread, where the last close of a foreign descriptor could wait.
constexpr std::size_t kMaxInFlightDescriptors = 253;

WorkerResult waitForMessage(int fd, Clock::time_point deadline) noexcept {
  for (;;) {
    int milliseconds = -1;
    if (deadline != Clock::time_point::max()) {
      const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
      milliseconds = static_cast<int>(std::clamp<std::chrono::milliseconds::rep>(left.count(), 0, INT_MAX));
    }
    pollfd ready{fd, POLLIN, 0};
    const int polled = ::poll(&ready, 1, milliseconds);
    if (polled > 0) return WorkerResult::done;
    if (polled == 0) return WorkerResult::timedOut;
    if (errno != EINTR) return WorkerResult::outOfMemory;
  }
}

// What waits to be closed: descriptors of four messages at most, and channels that nobody reads any more.
constexpr std::size_t kMaxToClose = 4 * (kMaxInFlightDescriptors + 3);
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

// Whether nothing lies unread in a socket that nobody can fill any more.
bool isEmpty(int socket) noexcept {
  // Each message has its sender's credentials now, for which there is no room: an empty one can be told from
  // none.
  const int on = 1;
  if (::setsockopt(socket, SOL_SOCKET, SO_PASSCRED, &on, sizeof on) != 0) return false;
  char byte = 0;
  iovec io{&byte, 1};
  msghdr message{};
  message.msg_iov = &io;
  message.msg_iovlen = 1;
  return ::recvmsg(socket, &message, MSG_PEEK | MSG_DONTWAIT) == 0 && (message.msg_flags & MSG_CTRUNC) == 0;
}

}  // namespace

bool WorkerChannel::hasRoomToDistrust() noexcept {
  try {
    return closingLine().hasRoomFor(kMaxInFlightDescriptors + kRoomForChannels);
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
    if (!isEmpty(socket_.get())) closeElsewhere(std::move(socket_));
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
  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0) return WorkerResult::outOfMemory;
  *one = WorkerChannel(UniqueFd(ends[0]));
  *other = WorkerChannel(UniqueFd(ends[1]));
  return WorkerResult::done;
}

WorkerResult WorkerChannel::send(const WorkerMessage& message) noexcept {
  if (!socket_.isValid()) return WorkerResult::closed;
  if (message.payload.size() > WorkerMessage::kLongestPayload ||
      message.descriptors.size() > WorkerMessage::kMaxDescriptors) {
    return WorkerResult::malformed;
  }
  const std::size_t count = std::min(message.descriptors.size(), WorkerMessage::kMaxDescriptors);
  std::array<int, WorkerMessage::kMaxDescriptors> descriptors{};
  for (std::size_t i = 0; i < count; ++i) descriptors[i] = message.descriptors[i].get();
  std::uint32_t kind = message.kind;
  std::array<iovec, 2> pieces{
      {{&kind, sizeof kind}, {const_cast<std::byte*>(message.payload.data()), message.payload.size()}}};
  msghdr out{};
  out.msg_iov = pieces.data();
  out.msg_iovlen = pieces.size();
  alignas(cmsghdr) std::array<char, CMSG_SPACE(WorkerMessage::kMaxDescriptors * sizeof(int))> control{};
  if (count > 0) {
    const std::size_t bytes = count * sizeof(int);
    out.msg_control = control.data();
    out.msg_controllen = CMSG_SPACE(bytes);
    cmsghdr* const item = CMSG_FIRSTHDR(&out);
    item->cmsg_level = SOL_SOCKET;
    item->cmsg_type = SCM_RIGHTS;
    item->cmsg_len = CMSG_LEN(bytes);
    std::memcpy(CMSG_DATA(item), descriptors.data(), bytes);
  }
  for (;;) {
    if (::sendmsg(socket_.get(), &out, MSG_DONTWAIT | MSG_NOSIGNAL) >= 0) return WorkerResult::done;
    switch (errno) {
      case EINTR:
        continue;
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
}

WorkerResult WorkerChannel::receive(WorkerMessage* message, Clock::time_point deadline) noexcept {
  message->kind = 0;
  message->payload.clear();
  message->descriptors.clear();
  if (!socket_.isValid()) return WorkerResult::closed;

  std::uint32_t kind = 0;
  alignas(8) std::array<std::byte, WorkerMessage::kLongestPayload> bytes;  // written by the kernel only
  std::array<iovec, 2> pieces{{{&kind, sizeof kind}, {bytes.data(), bytes.size()}}};
  alignas(cmsghdr)
      std::array<char, CMSG_SPACE(kMaxInFlightDescriptors * sizeof(int)) + CMSG_SPACE(sizeof(ucred))>
          control;
  msghdr in{};
  ssize_t size = -1;
  const bool forEver = deadline == Clock::time_point::max();
  for (;;) {
    if (!forEver) {
      if (const WorkerResult waited = waitForMessage(socket_.get(), deadline); waited != WorkerResult::done)
        return waited;
    }
    if (isDistrusted_ && !hasRoomToDistrust()) return WorkerResult::unavailable;
    in = {};
    in.msg_iov = pieces.data();
    in.msg_iovlen = pieces.size();
    in.msg_control = control.data();
    in.msg_controllen = control.size();
    size = ::recvmsg(socket_.get(), &in, MSG_CMSG_CLOEXEC | (forEver ? 0 : MSG_DONTWAIT));
    if (size >= 0) break;
    if (errno == EINTR || errno == EAGAIN) continue;
    return errno == ENOMEM || errno == ENOBUFS ? WorkerResult::outOfMemory : WorkerResult::closed;
  }

  std::array<UniqueFd, kMaxInFlightDescriptors> received;
  std::size_t count = 0;
  for (cmsghdr* item = CMSG_FIRSTHDR(&in); item != nullptr; item = CMSG_NXTHDR(&in, item)) {
    if (item->cmsg_level != SOL_SOCKET || item->cmsg_type != SCM_RIGHTS) continue;
    const std::size_t inItem = (item->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (std::size_t i = 0; i < inItem && count < received.size(); ++i) {
      int fd = -1;
      std::memcpy(&fd, CMSG_DATA(item) + i * sizeof fd, sizeof fd);
      received[count++].reset(fd);
    }
  }
  // Of what is not handed over.
  struct Dropped {
    std::span<UniqueFd> all;
    bool isDistrusted;
    ~Dropped() {
      for (UniqueFd& each : all) {
        if (isDistrusted && each.isValid()) closeElsewhere(std::move(each));
      }
    }
  } const dropped{std::span(received).first(count), isDistrusted_};
  if (size == 0) return WorkerResult::closed;
  // There was room for all: what the kernel had to leave out found no free descriptor in this process.
  if ((in.msg_flags & MSG_CTRUNC) != 0 && count <= WorkerMessage::kMaxDescriptors)
    return WorkerResult::outOfMemory;
  if ((in.msg_flags & (MSG_TRUNC | MSG_CTRUNC)) != 0 || static_cast<std::size_t>(size) < sizeof kind ||
      count > WorkerMessage::kMaxDescriptors) {
    return WorkerResult::malformed;
  }
  try {
    message->payload.assign(bytes.data(), bytes.data() + (static_cast<std::size_t>(size) - sizeof kind));
    message->descriptors.reserve(count);
  } catch (const std::bad_alloc&) {
    message->payload.clear();
    return WorkerResult::outOfMemory;
  }
  for (std::size_t i = 0; i < count; ++i) message->descriptors.push_back(std::move(received[i]));
  message->kind = kind;
  return WorkerResult::done;
}

bool isChannelSocket(int fd) noexcept {
  const auto is = [fd](int option, int wanted) {
    int value = -1;
    socklen_t size = sizeof value;
    return ::getsockopt(fd, SOL_SOCKET, option, &value, &size) == 0 && value == wanted;
  };
  return is(SO_DOMAIN, AF_UNIX) && is(SO_TYPE, SOCK_SEQPACKET) && is(SO_ACCEPTCONN, 0);
}

}  // namespace brenvik
