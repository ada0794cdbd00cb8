// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include "platform/base/UniqueFd.h"

namespace brenvik {

// Closes descriptors that somebody else made, on threads of its own: the last close of a socket that lingers,
// or of a file of a user's own file system, waits for as long as its maker likes (see
// docs/decisions/11-door.md).
//
// A close that waits is interrupted every 100 ms, which ends a lingering. A file system that does not answer
// keeps its thread; no account keeps more than one, and an account that keeps one only delays what is its
// own, until its jobs fill the line. Threads start with the first job. Destroying the line waits a moment for
// what is left, and then leaves it to the end of the process. Members are called from any thread.
class ClosingLine {
 public:
  using SharedFd = std::shared_ptr<const UniqueFd>;

  // Whose jobs wait for each other. Clients that are checked in share one.
  using Account = uid_t;
  static constexpr Account kClients = static_cast<Account>(-1);

  // Jobs that may wait. Whoever makes jobs for strangers asks hasRoomFor() before it lets them make more.
  static constexpr std::size_t kCapacity = 512;

  explicit ClosingLine(std::size_t capacity = kCapacity);
  ~ClosingLine();
  ClosingLine(const ClosingLine&) = delete;
  ClosingLine& operator=(const ClosingLine&) = delete;

  // Closes the descriptor, on the caller's thread when the line is full.
  void close(UniqueFd descriptor, Account account) noexcept;

  // Takes one message off the socket and drops it with its descriptors; takeDiscarded() tells `token` then.
  // False when the line is full, or memory or descriptors are: nothing is done.
  bool discardMessage(SharedFd socket, Account account, std::uint64_t token) noexcept;

  bool hasRoomFor(std::size_t jobs) const noexcept;

  // Readable while takeDiscarded() has something to tell. -1 before the first discardMessage() that
  // succeeded.
  int readable() const noexcept;
  std::vector<std::uint64_t> takeDiscarded();

  // Waits until every job is done. For tests.
  void drain();

 private:
  struct State;
  const std::shared_ptr<State> state_;  // a thread that is stuck outlives the line
};

}  // namespace brenvik
