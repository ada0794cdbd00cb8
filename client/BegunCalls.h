// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <list>
#include <unordered_map>
#include <vector>

#include "client/Outgoing.h"
#include "client/Reply.h"

namespace brenvik::client {

// A call that was begun and whose result was not taken.
struct BegunCall {
  enum class State : std::uint8_t { waiting, sent, finished };

  BegunCall() = default;
  BegunCall(const BegunCall&) = delete;
  BegunCall& operator=(const BegunCall&) = delete;
  ~BegunCall() { bvmh_region_free(&result.region); }

  const RoutineFacts* routine = nullptr;  // kCheckInRoutine: a check-in, which has no message
  State state = State::waiting;
  bool isBlocking = false;   // a blocking call among begun ones: its number is nobody's
  bool wasReturned = false;  // a channel ended that it had been given to
  PortName replyPort = kNullPort;
  Deadline deadline = Deadline::never();
  bvmh_call publicNumber() const noexcept { return isBlocking ? 0 : result.call; }

  std::vector<std::byte> message;
  std::array<std::vector<std::byte>, kMaxRegions> regions;
  bvmh_result result{};
  std::list<BegunCall>::iterator place;  // in the list that it is in
};

// The begun calls of a client: those that wait to be sent, those that wait for their answer, each in their
// order, and those that have finished, the first one first.
class BegunCalls {
 public:
  using List = std::list<BegunCall>;
  using Place = List::iterator;

  std::size_t size() const noexcept { return byNumber_.size(); }
  // None is on its way.
  bool areFinished() const noexcept { return waiting_.empty() && sent_.empty(); }
  List& waiting() noexcept { return waiting_; }
  List& sent() noexcept { return sent_; }
  List& finished() noexcept { return finished_; }

  // Behind those that wait. Throws std::bad_alloc, and then nothing was added.
  Place add(bvmh_call number);
  BegunCall* find(bvmh_call number) noexcept;
  void remove(BegunCall& call) noexcept;

  void markSent(Place waiting) noexcept;
  // Back to the front of those that wait.
  void markReturned(Place sent) noexcept;
  void finish(BegunCall& call, std::int32_t code, int systemError = 0) noexcept;

 private:
  List& listOf(const BegunCall& call) noexcept;

  List waiting_;
  List sent_;
  List finished_;
  std::unordered_map<bvmh_call, Place> byNumber_;
};

}  // namespace brenvik::client
