// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

// What the status socket sends: one datagram of lines "key=value", the same on both sides.
namespace brenvik {

// The status socket is the service socket's path and this.
inline constexpr std::string_view kStatusSocketSuffix = ".status";

// A reader takes nothing larger. Names and words in it are short, so a real one stays far below.
inline constexpr std::size_t kLargestStatus = 16384;

// Something that happened, and how long ago.
struct StatusEvent {
  std::string outcome;
  std::chrono::milliseconds age{0};
  bool operator==(const StatusEvent&) const = default;
};

struct StatusReport {
  // Reasons for busy tokens, as they are sent; see busyReasons() for people's words.
  static constexpr const char* kDatabaseCheck = "database-check";
  static constexpr const char* kHeartbeat = "heartbeat";

  struct Busy {
    std::string reason;
    std::uint64_t tokens = 0;
    bool operator==(const Busy&) const = default;
  };
  struct Traffic {
    std::uint64_t packets = 0;
    std::uint64_t bytes = 0;
    bool operator==(const Traffic&) const = default;
  };
  using Event = StatusEvent;
  struct Database {
    std::string type;
    Event lastCheck;  // "checking", "updated", "no-update-required" or "failed"
    bool operator==(const Database&) const = default;
  };
  struct Worker {
    std::string name;
    bool isRunning = false;
    bool operator==(const Worker&) const = default;
  };

  std::string version;
  std::uint64_t process = 0;
  std::string executable;   // absolute path; empty: not known
  bool isReplaced = false;  // another file stands there now
  std::string socket;       // of the service
  std::chrono::milliseconds running{0};
  std::uint64_t clients = 0;
  std::uint64_t busyTokens = 0;
  std::vector<Busy> busy;
  bool isKeptByBaseband = false;                      // at the last tick of the idle timer
  std::optional<std::chrono::milliseconds> leavesIn;  // the next tick; none: nothing is counted down
  bool isHeartbeatOn = false;
  Traffic heartbeatSent;
  Traffic heartbeatReceived;
  std::vector<Database> databases;      // those that were checked, in the order of checks
  std::optional<Event> locationAnswer;  // "answered", "failed" or "timed-out"
  std::vector<Worker> workers;

  bool operator==(const StatusReport&) const = default;
};

// The datagram. What would break a line is left out of its value; a malformed word becomes "unknown".
std::string writeStatus(const StatusReport& report);

// Nothing when the text is no such datagram. Keys that are not known are passed over, so that a newer helper
// is understood.
std::optional<StatusReport> readStatus(std::string_view text);

// What keeps the helper from leaving, in words: "2 clients", "a database check", "the heartbeat". Empty:
// nothing does.
std::vector<std::string> busyReasons(const StatusReport& report);

}  // namespace brenvik
