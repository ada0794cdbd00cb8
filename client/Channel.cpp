// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Channel.h"

#include <poll.h>

#include <cerrno>

#include "platform/datagram/Datagram.h"

namespace brenvik::client {
namespace {

// Sets errno where it says `failed`.
Io ioOf(int error) noexcept {
  switch (error) {
    case 0:
      return Io::done;
    case ETIMEDOUT:
      return Io::timedOut;
    case EPIPE:
      return Io::closed;
    case ECONNRESET:
      return Io::reset;
    default:
      errno = error;
      return Io::failed;
  }
}

}  // namespace

Io sendMessage(int socket, std::span<const iovec> parts, std::span<const int> descriptors, Deadline deadline,
               Waiting* next) noexcept {
  for (;;) {
    const int error = sendDatagram(socket, parts, descriptors);
    if (error != EAGAIN) return ioOf(error);
    if (*next == Waiting::never) return Io::timedOut;
    *next = Waiting::byPoll;
    if (const int waited = waitFor(socket, POLLOUT, deadline); waited != 0) return ioOf(waited);
  }
}

Io receiveMessage(int socket, std::span<std::byte> buffer, Deadline deadline, Waiting waiting,
                  Incoming* incoming) noexcept {
  *incoming = Incoming{};
  const iovec room{buffer.data(), buffer.size()};
  ControlRoom<kMaxDescriptors> control;
  ReceivedDatagram received;
  int error = EINTR;
  while (error == EINTR || error == EAGAIN) {
    if (waiting == Waiting::byPoll) {
      if (const int waited = waitFor(socket, POLLIN, deadline); waited != 0) return ioOf(waited);
    }
    error = receiveDatagram(socket, std::span(&room, 1), control.bytes, incoming->descriptors,
                            waiting == Waiting::bySocketOption ? 0 : MSG_DONTWAIT, &received);
    if (error == EAGAIN && waiting == Waiting::never) return Io::timedOut;
    if (waiting == Waiting::never) continue;
    if ((error == EINTR || error == EAGAIN) && deadline.hasPassed()) return Io::timedOut;
    // Whatever ended the first try early, a signal or a socket that does not block, poll does the rest.
    waiting = Waiting::byPoll;
  }
  if (error != 0) return ioOf(error);
  incoming->length = received.length;
  incoming->isCut = received.areBytesCut || received.areDescriptorsCut;
  incoming->descriptorCount = received.descriptorCount;
  return received.length == 0 ? Io::closed : Io::done;
}

}  // namespace brenvik::client
