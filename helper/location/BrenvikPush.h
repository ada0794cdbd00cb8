// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/telephony/TelephonyDaemonConnection.h"

namespace brenvik {

// A fresh connection to Brenvik in this program's name; null when none can be made.
std::unique_ptr<TelephonyDaemonConnection> openBrenvik(TelephonyDaemon& daemon);

// The text as the platform takes it; absent when it is not valid UTF-8.
std::optional<std::string> platformString(const std::string& text);

}  // namespace brenvik
