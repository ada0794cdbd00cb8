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

// The datagram that the status socket sends: lines "key=value". Helper and reader share this code. Writing
// and reading throw std::bad_alloc.
namespace brenvik {

// The status socket's path is the service socket's path plus this suffix.
inline constexpr std::string_view kStatusSocketSuffix = ".status";

// The largest datagram that a reader accepts, in bytes. Names and words in it are short, so a real one is far
// smaller.
inline constexpr std::size_t kLargestStatus = 16384;

// Something that happened, and how long ago.
struct StatusEvent {
  std::string outcome;
  std::chrono::milliseconds age{0};
  bool operator==(const StatusEvent&) const = default;
};

struct StatusReport {
  // Reasons for busy tokens, as they are sent; busyReasons() has the words for people.
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
  std::string executable;   // absolute path; empty: unknown
  bool isReplaced = false;  // another file has that path now
  std::string socket;       // of the service
  std::chrono::milliseconds running{0};
  std::uint64_t clients = 0;
  std::uint64_t busyTokens = 0;
  std::vector<Busy> busy;
  bool isKeptByBaseband = false;                      // at the last tick of the idle timer
  std::optional<std::chrono::milliseconds> leavesIn;  // time to the next tick; none: no countdown runs
  bool isHeartbeatOn = false;
  Traffic heartbeatSent;
  Traffic heartbeatReceived;
  std::vector<Database> databases;      // those that were checked, in the order of checks
  std::optional<Event> locationAnswer;  // "answered", "failed" or "timed-out"
  std::vector<Worker> workers;

  bool operator==(const StatusReport&) const = default;
};

// Writes the datagram. Characters that would break a line are left out; a malformed word becomes "unknown".
std::string writeStatus(const StatusReport& report);

// Reads the datagram; returns nothing if it is malformed. Unknown keys are ignored, so that a newer helper is
// understood.
std::optional<StatusReport> readStatus(std::string_view text);

// The reasons why the helper does not leave, in words: "2 clients", "a database check", "the heartbeat".
// Empty if there are none.
std::vector<std::string> busyReasons(const StatusReport& report);

}  // namespace brenvik
