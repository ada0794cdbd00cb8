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

  // Turns logging to a file off if `enable` is 0, else on. Always returns kern::success, because nobody knows
  // whether the radio manager received it.
  KernelReturn enableRadioManagerLogs(PortName port, std::int32_t enable) noexcept;

 private:
  RadioManager& radio_;
};

}  // namespace brenvik
