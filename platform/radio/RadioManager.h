// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

namespace brenvik {

// The wireless radio manager; the helper uses only one switch of it. Main loop only; never waits for the
// service.
class RadioManager {
 public:
  virtual ~RadioManager() = default;
  // Turns logging to a file on or off. Reports nothing; without the service, it does nothing.
  virtual void setLogToFile(bool enable) noexcept = 0;
};

}  // namespace brenvik
