// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "brenvik/mobile_helper.h"

namespace brenvik::tools {

// How a stand-in for the telephony daemon behaves.
struct EventStreamOptions {
  std::string program;  // its name, for messages
  // Of the two services. Empty: the sockets that a service manager handed over, else the place compiled in.
  std::string directory;
  bool asJson = false;
  bool answers = true;                // false: pushes are printed and never answered
  std::int32_t errorCode = 0;         // of the answers; 0: success
  std::optional<std::uint64_t> most;  // leave after so many pushes and notifications
  std::optional<std::uint32_t> helperUid;
};

// Listens on the two services and prints a line to standard output for each push and notification, until
// enough have come, or an interrupt or a request to end does. Says on standard error where it listens.
// The exit status: 0, or 2 when it cannot listen.
int printEvents(const EventStreamOptions& options);

// The line of one event, without its end. `answer` says what became of it; only a push has one.
std::string eventLine(const bvmh_event& event, const std::string& answer, bool asJson);

}  // namespace brenvik::tools
