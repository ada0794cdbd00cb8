// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// The wireless radio manager, of which one switch is used. Main loop only; never waits for the service.
class RadioManager {
 public:
  virtual ~RadioManager() = default;
  // Logging to file on or off. Nothing is reported: where the service is absent, nothing happens.
  virtual void setLogToFile(bool enable) noexcept = 0;
};

}  // namespace brenvik
