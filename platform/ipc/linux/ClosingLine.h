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

// Closes descriptors that another process made, on threads of its own. The last close of a socket that
// lingers, or of a file on a user's own file system, can block for as long as that user likes (see
// docs/decisions/11-door.md).
//
// A close that blocks is interrupted every 100 ms, which ends lingering. A file system that does not answer
// blocks its thread. No account can block more than one thread; its blocked thread delays only its own
// descriptors, until its jobs fill the line. The threads start with the first job. The destructor waits a
// moment for the remaining jobs and leaves the rest to the end of the process. Any thread.
class ClosingLine {
 public:
  using SharedFd = std::shared_ptr<const UniqueFd>;

  // Jobs of one account wait for each other. All clients that are checked in share kClients.
  using Account = uid_t;
  static constexpr Account kClients = static_cast<Account>(-1);

  // The number of jobs that may wait. Callers that accept work from strangers ask hasRoomFor() first.
  static constexpr std::size_t kCapacity = 512;

  explicit ClosingLine(std::size_t capacity = kCapacity);
  ~ClosingLine();
  ClosingLine(const ClosingLine&) = delete;
  ClosingLine& operator=(const ClosingLine&) = delete;

  // Closes the descriptor; on the caller's thread if the line is full.
  void close(UniqueFd descriptor, Account account) noexcept;

  // Takes one message off the socket and drops it with its descriptors; takeDiscarded() then returns `token`.
  // Returns false and does nothing if the line is full, or if memory or descriptors run out.
  bool discardMessage(SharedFd socket, Account account, std::uint64_t token) noexcept;

  bool hasRoomFor(std::size_t jobs) const noexcept;

  // A descriptor that is readable while takeDiscarded() has a token to return; -1 before the first
  // discardMessage() that succeeded. The line owns it.
  int readable() const noexcept;
  std::vector<std::uint64_t> takeDiscarded();

  // Waits until every job is done. For tests.
  void drain();

 private:
  struct State;
  const std::shared_ptr<State> state_;  // a blocked thread outlives the line
};

}  // namespace brenvik
