// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <memory>

#include "platform/base/UniqueFd.h"

namespace brenvik::client {

// Closes connections of strangers. What a stranger has put into one is closed with it, and the last close of
// a socket that lingers waits for as long as its maker likes, an hour for instance. So a connection that is
// not empty is closed by a thread of its own. There are few such threads: while all of them are busy,
// hasRoom() says no, and nobody should be accepted.
class TurnedAway {
 public:
  static constexpr std::size_t kMaxThreads = 16;
  static constexpr std::size_t kMaxListening = 2;

  // False with errno set when memory or descriptors are lacking.
  bool prepare() noexcept;
  // Precondition: prepare().
  bool hasRoom() const noexcept;
  // Closes the connection, here or elsewhere. Precondition: hasRoom().
  void close(UniqueFd connection) noexcept;
  // Closes a listening socket, and with it the connections that nobody has accepted and what was sent over
  // them; if there are any, on a thread. Has room for kMaxListening sockets, whatever hasRoom() says.
  // Precondition: prepare().
  void closeListening(UniqueFd listening) noexcept;
  // Readable when there may be room again; wasTold() ends that. -1 before prepare().
  int readable() const noexcept;
  void wasTold() const noexcept;

 private:
  void closeOnThread(UniqueFd descriptor) noexcept;

  struct State;
  std::shared_ptr<State> state_;  // a thread that waits outlives the listener
};

}  // namespace brenvik::client
