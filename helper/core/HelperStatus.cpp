// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/core/HelperStatus.h"

#include <unistd.h>

#include <utility>

#include "helper/lasd/DatabaseTypes.h"

namespace brenvik {
namespace {

using std::chrono::duration_cast;
using std::chrono::milliseconds;

const char* nameOf(LASDUpdater::LastCheck::Outcome outcome) noexcept {
  using Outcome = LASDUpdater::LastCheck::Outcome;
  switch (outcome) {
    case Outcome::checking:
      return "checking";
    case Outcome::updated:
      return "updated";
    case Outcome::noUpdateRequired:
      return "no-update-required";
    case Outcome::failed:
      return "failed";
  }
  return "unknown";
}

const char* nameOf(GeoRequestState::Ending ending) noexcept {
  using Ending = GeoRequestState::Ending;
  switch (ending) {
    case Ending::answered:
      return "answered";
    case Ending::failed:
      return "failed";
    case Ending::timedOut:
      return "timed-out";
  }
  return "unknown";
}

StatusReport::Traffic trafficOf(const CellularHeartbeat::Traffic& traffic) noexcept {
  return {traffic.packets, traffic.bytes};
}

}  // namespace

StatusReport::Event HelperStatus::event(std::string outcome, std::chrono::nanoseconds when) const {
  return {std::move(outcome), duration_cast<milliseconds>(sources_.now() - when)};
}

StatusReport HelperStatus::report() const {
  StatusReport report;
  const ServerFacts server = sources_.server.facts();
  report.clients = server.clients;
  for (const auto& [reason, tokens] : server.busyTokens) {
    report.busy.push_back({reason, tokens});
    report.busyTokens += tokens;
  }
  report.isKeptByBaseband = server.isKeptByIdleCheck;
  // Rounded up: what is left is never told as nothing.
  if (server.leavesIn) report.leavesIn = std::chrono::ceil<milliseconds>(*server.leavesIn);

  report.version = sources_.version;
  report.process = static_cast<std::uint64_t>(::getpid());
  ProgramFacts program = sources_.program();
  report.executable = std::move(program.path);
  report.isReplaced = program.isReplaced;
  report.socket = sources_.socket;
  report.running = duration_cast<milliseconds>(sources_.now() - began_);

  report.isHeartbeatOn = sources_.heartbeat.isOn();
  report.heartbeatSent = trafficOf(sources_.heartbeat.sent());
  report.heartbeatReceived = trafficOf(sources_.heartbeat.received());
  for (const auto& each : sources_.lasd.lastChecks()) {
    report.databases.push_back({nameOfDatabaseType(each.type), event(nameOf(each.outcome), each.when)});
  }
  if (const auto last = sources_.location.lastEnding()) {
    report.locationAnswer = event(nameOf(last->ending), last->when);
  }
  if (sources_.workers) report.workers = sources_.workers();
  return report;
}

std::string HelperStatus::line() const {
  const StatusReport now = report();
  std::string text;
  for (const std::string& each : busyReasons(now)) text += (text.empty() ? "" : ", ") + each;
  if (!text.empty()) return "Kept by " + text;
  return now.leavesIn ? "Idle, leaves soon" : "Waits for its first client";
}

}  // namespace brenvik
