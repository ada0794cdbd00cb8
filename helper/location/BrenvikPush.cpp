// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/location/BrenvikPush.h"

#include "platform/base/Utf8.h"
#include "platform/log/Log.h"

namespace brenvik {

std::unique_ptr<TelephonyDaemonConnection> openBrenvik(TelephonyDaemon& daemon) {
  daemon.addIdentifierException("BrenvikMobileHelper");
  return daemon.create(
      [] { logBsd(SyslogPriority::notice, "_ServerConnectionCallback for BrenvikMobileHelper"); });
}

std::optional<std::string> platformString(const std::string& text) {
  if (!isValidUtf8(text)) return std::nullopt;
  return text;
}

}  // namespace brenvik
