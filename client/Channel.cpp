// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Channel.h"

#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>

namespace brenvik::client {
namespace {

// SCM_PIDFD of Linux 6.5, which the C library's headers do not name yet. Only the peer's wish, set on the
// socket before we got it, makes such a message; its descriptor would stay open otherwise.
constexpr int kScmPidfd = 4;

void takeDescriptors(const cmsghdr& control, Incoming* incoming) noexcept {
  const std::size_t bytes = control.cmsg_len - CMSG_LEN(0);
  for (std::size_t at = 0; at + sizeof(int) <= bytes; at += sizeof(int)) {
    int number = -1;
    std::memcpy(&number, CMSG_DATA(&control) + at, sizeof number);
    UniqueFd descriptor(number);
    if (control.cmsg_type != SCM_RIGHTS) continue;
    if (incoming->descriptorCount == kMaxDescriptors) {
      incoming->isCut = true;
      continue;
    }
    incoming->descriptors[incoming->descriptorCount++] = std::move(descriptor);
  }
}

Io ioOf(int error) noexcept {
  switch (error) {
    case EPIPE:
      return Io::closed;
    case ECONNRESET:
      return Io::reset;
    default:
      return Io::failed;
  }
}

}  // namespace

int Deadline::millisecondsForPoll() const noexcept {
  if (end_ == Clock::time_point::max()) return -1;
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(end_ - Clock::now()).count();
  return static_cast<int>(std::clamp<std::int64_t>(left, 0, INT_MAX));
}

timespec Deadline::forTimer() const noexcept {
  if (end_ == Clock::time_point::max()) return {};
  // steady_clock is CLOCK_MONOTONIC on Linux.
  const auto time = std::chrono::duration_cast<std::chrono::nanoseconds>(end_.time_since_epoch()).count();
  return {time / 1'000'000'000, time % 1'000'000'000};
}

Io waitFor(int descriptor, short events, Deadline deadline) noexcept {
  for (;;) {
    pollfd entry{descriptor, events, 0};
    const int ready = ::poll(&entry, 1, deadline.millisecondsForPoll());
    if (ready > 0) return Io::done;
    if (ready < 0 && errno != EINTR) return Io::failed;
    if (deadline.hasPassed()) return Io::timedOut;
  }
}

Io sendMessage(int socket, std::span<const iovec> parts, std::span<const int> descriptors, Deadline deadline,
               Waiting* next) noexcept {
  alignas(cmsghdr) std::array<std::byte, CMSG_SPACE(kMaxDescriptors * sizeof(int))> control{};
  msghdr message{};
  message.msg_iov = const_cast<iovec*>(parts.data());  // sendmsg only reads them
  message.msg_iovlen = parts.size();
  if (!descriptors.empty()) {
    message.msg_control = control.data();
    message.msg_controllen = CMSG_SPACE(descriptors.size_bytes());
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(descriptors.size_bytes());
    std::memcpy(CMSG_DATA(header), descriptors.data(), descriptors.size_bytes());
  }
  // Most messages are one piece, which send takes 5 % faster.
  const bool isPlain = parts.size() == 1 && descriptors.empty();
  constexpr int kFlags = MSG_DONTWAIT | MSG_NOSIGNAL;
  for (;;) {
    const ssize_t sent = isPlain ? ::send(socket, parts[0].iov_base, parts[0].iov_len, kFlags)
                                 : ::sendmsg(socket, &message, kFlags);
    if (sent >= 0) return Io::done;
    if (errno == EINTR) continue;
    if (errno != EAGAIN) return ioOf(errno);
    if (*next == Waiting::never) return Io::timedOut;
    *next = Waiting::byPoll;
    if (const Io waited = waitFor(socket, POLLOUT, deadline); waited != Io::done) return waited;
  }
}

Io receiveMessage(int socket, std::span<std::byte> buffer, Deadline deadline, Waiting waiting,
                  Incoming* incoming) noexcept {
  *incoming = Incoming{};
  int flags = MSG_CMSG_CLOEXEC | (waiting == Waiting::bySocketOption ? 0 : MSG_DONTWAIT);
  for (;;) {
    if ((flags & MSG_DONTWAIT) != 0 && waiting != Waiting::never) {
      if (const Io waited = waitFor(socket, POLLIN, deadline); waited != Io::done) return waited;
    }
    // Room for the rights of a message and for credentials and a pidfd, should the peer have asked for them.
    alignas(cmsghdr) std::array<std::byte, CMSG_SPACE(kMaxDescriptors * sizeof(int)) +
                                               CMSG_SPACE(sizeof(ucred)) + CMSG_SPACE(sizeof(int))>
        control;
    iovec part{buffer.data(), buffer.size()};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control.data();
    message.msg_controllen = control.size();
    const ssize_t length = ::recvmsg(socket, &message, flags);
    if (length < 0) {
      // Whatever ended the first try early, a signal or a socket that does not block, poll does the rest.
      flags |= MSG_DONTWAIT;
      if (errno != EINTR && errno != EAGAIN) return ioOf(errno);
      if (waiting == Waiting::never && errno == EAGAIN) return Io::timedOut;
      if (waiting != Waiting::never && deadline.hasPassed()) return Io::timedOut;
      continue;
    }
    incoming->length = static_cast<std::size_t>(length);
    incoming->isCut = (message.msg_flags & (MSG_TRUNC | MSG_CTRUNC)) != 0;
    for (cmsghdr* each = CMSG_FIRSTHDR(&message); each != nullptr; each = CMSG_NXTHDR(&message, each)) {
      if (each->cmsg_level != SOL_SOCKET) continue;
      if (each->cmsg_type == SCM_RIGHTS || each->cmsg_type == kScmPidfd) takeDescriptors(*each, incoming);
    }
    return length == 0 ? Io::closed : Io::done;
  }
}

}  // namespace brenvik::client
