// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>

#include "client/include/brenvik/mobile_helper.h"

namespace brenvik::client {

// The location requests of a client that no push has answered yet. A push does not name its request, so the
// match is certain only while there is exactly one of its kind.
class Questions {
 public:
  using Time = std::chrono::steady_clock::time_point;
  // A push comes within about five seconds; twice that allows for a busy helper.
  static constexpr std::chrono::seconds kAnswerTime{10};

  static bool isQuestion(std::int32_t routine) noexcept;
  // Records a request; ignores routines that are not location requests. Number 0: a blocking call.
  void asked(std::int32_t routine, bvmh_call number, Time now) noexcept;
  // Forgets a request that the helper refused.
  void refused(std::int32_t routine, bvmh_call number) noexcept;
  // Result as bvmh_match_push.
  std::int32_t answered(bvmh_event_kind push, Time now, bvmh_call* number) noexcept;

 private:
  struct Question {
    bool isOpen = false;
    bvmh_call number = 0;
    Time time{};
  };
  // The newest two of each kind: more than one is as good as many.
  using Kind = std::array<Question, 2>;

  Kind* kindOf(std::int32_t routine) noexcept;

  std::array<Kind, 2> kinds_;
};

}  // namespace brenvik::client
