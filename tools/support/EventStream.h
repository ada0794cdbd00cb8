// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstdint>
#include <nlohmann/json_fwd.hpp>
#include <optional>
#include <string>

#include "brenvik/mobile_helper.h"
#include "platform/base/UniqueFd.h"
#include "tools/support/ExitStatus.h"

namespace brenvik::tools {

// A deadline. Without a time it never ends.
class Patience {
 public:
  explicit Patience(std::optional<double> seconds);
  bool isOver() const { return end_ && Clock::now() >= *end_; }
  // What is left, as poll(2) takes it, and at most `most`.
  int milliseconds(int most = 1'000'000'000) const;

 private:
  using Clock = std::chrono::steady_clock;
  std::optional<Clock::time_point> end_;
};

// The telephony daemon's place, taken for a while: its named services, and SIGINT and SIGTERM as input, so
// that the socket files are removed on the way out.
class StandIn {
 public:
  StandIn() = default;
  StandIn(const StandIn&) = delete;
  StandIn& operator=(const StandIn&) = delete;
  ~StandIn();

  // Listens for BVMH_PUSHES, BVMH_NOTIFICATIONS or both. An empty directory stands for the sockets that a
  // service manager handed over, else for the place compiled in. False: reason() says why.
  bool listen(const std::string& directory, unsigned services, std::optional<std::uint32_t> helperUid);
  enum class Came : std::uint8_t { event, nothing, interrupt, failure };
  // Waits for the next event, which bvmh_event_free frees; `nothing` after `milliseconds` (-1: never).
  Came next(int milliseconds, bvmh_event* event);
  // Answers a push, with 0 for success. False: nobody waits for it any more.
  bool answer(const bvmh_event& event, std::int32_t errorCode);
  const std::string& reason() const { return reason_; }
  // What to do when listen() failed; may be empty.
  const std::string& advice() const { return advice_; }
  // Where it listens, for people: "in /run/x".
  const std::string& place() const { return place_; }

 private:
  bool fail(std::int32_t code, int error);

  bvmh_listener* listener_ = nullptr;
  UniqueFd signals_;
  std::string reason_;
  std::string advice_;
  std::string place_;
};

// How a stand-in for the telephony daemon behaves.
struct EventStreamOptions {
  std::string program;  // its name, for messages
  // Of the two services. Empty: the sockets that a service manager handed over, else the place compiled in.
  std::string directory;
  bool asJson = false;
  bool answers = true;                // false: pushes are printed and never answered
  std::int32_t errorCode = 0;         // of the answers; 0: success
  std::optional<std::uint64_t> most;  // leave after so many pushes and notifications
  std::optional<double> seconds;      // leave after so long
  std::optional<std::uint32_t> helperUid;
};

// Listens on the two services and prints a line to standard output for each push and notification, until
// `most` of them arrived, the time has passed, or SIGINT or SIGTERM. Standard error says where it listens,
// and what went wrong; with asJson, standard output says what went wrong. timedOut when the time passed
// before `most` arrived, failed when it cannot listen, outputLost when a line could not be written.
ExitStatus printEvents(const EventStreamOptions& options);

// The line of one event, without its end. `answer` says what became of it; only a push has one.
std::string eventLine(const bvmh_event& event, const std::string& answer, bool asJson);

// What went wrong, as both programs say it: on standard error, or with asJson as an object on standard
// output.
void printFailure(const std::string& program, bool asJson, const std::string& message,
                  const std::string& advice, const nlohmann::ordered_json& fields);

}  // namespace brenvik::tools
