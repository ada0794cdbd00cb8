// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

namespace brenvik {

// Guesses whether the next message of a channel is there when one has been answered. A look for it costs a
// system call: less than a turn of the loop when there is a message, and wasted when the client waits for
// each answer before it sends its next request.
//
// The guess learns from two facts. A look that found nothing says no. A turn that began as soon as the one
// before had ended says yes, because the loop did not have to wait for the message. Main loop only.
class BacklogGuess {
 public:
  using Time = std::chrono::steady_clock::time_point;

  // Only one in so many turns is timed, because reading the clock twice costs 1 % of a call.
  static constexpr unsigned kTimedTurns = 8;
  // If a message is there, the loop comes back with it in a third of that time. A sleeping client takes three
  // times as long to wake up and send.
  static constexpr std::chrono::nanoseconds kAtOnce{1000};

  // The channel's turn begins, or ends. `now` returns the time; it is called only if the turn is timed.
  template <class Now>
  void turnBegins(Now&& now) {
    if (isTimed_) isLikely_ = now() - ended_ < kAtOnce;
    isTimed_ = false;
  }
  template <class Now>
  void turnEnds(Now&& now) {
    if (isLikely_ || ++turns_ % kTimedTurns != 0) return;
    isTimed_ = true;
    ended_ = now();
  }
  // A look found nothing.
  void foundNothing() noexcept { isLikely_ = false; }

  // Whether it is worth looking for another message.
  bool isLikely() const noexcept { return isLikely_; }

 private:
  bool isLikely_ = false;
  bool isTimed_ = false;
  unsigned turns_ = 0;
  Time ended_{};  // when the last timed turn ended
};

}  // namespace brenvik
