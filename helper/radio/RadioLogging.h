// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>

#include "interface/Wire.h"
#include "platform/radio/RadioManager.h"

namespace brenvik {

// The routine that switches the wireless radio manager's logging. Main loop only.
class RadioLogging {
 public:
  // `radio` must outlive this object.
  explicit RadioLogging(RadioManager& radio) noexcept : radio_(radio) {}

  // Logging to file on for any `enable` but 0, off for 0. Always kern::success: whether the radio manager
  // heard it is not known.
  KernelReturn enableRadioManagerLogs(PortName port, std::int32_t enable) noexcept;

 private:
  RadioManager& radio_;
};

}  // namespace brenvik
