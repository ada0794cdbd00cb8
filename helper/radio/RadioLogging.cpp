// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/radio/RadioLogging.h"

#include "platform/log/Log.h"

namespace brenvik {

KernelReturn RadioLogging::enableRadioManagerLogs(PortName, std::int32_t enable) noexcept {
  radio_.setLogToFile(enable != 0);
  logBsd(SyslogPriority::error, "Enabling wireless radio manager logs: %d", enable);
  return kern::success;
}

}  // namespace brenvik
