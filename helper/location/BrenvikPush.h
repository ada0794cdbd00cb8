// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/telephony/TelephonyDaemonConnection.h"

namespace brenvik {

// Opens a new connection to Brenvik in this program's name; returns null if that fails.
std::unique_ptr<TelephonyDaemonConnection> openBrenvik(TelephonyDaemon& daemon);

// Returns the text if it is valid UTF-8, else nothing.
std::optional<std::string> platformString(const std::string& text);

}  // namespace brenvik
