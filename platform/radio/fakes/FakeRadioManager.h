// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>
#include <vector>

#include "platform/radio/RadioManager.h"

namespace brenvik {

// Remembers how its switch was set. Main thread only.
class FakeRadioManager final : public RadioManager {
 public:
  void setLogToFile(bool enable) noexcept override {
    switched.push_back(enable);
    if (whenSwitched) whenSwitched();
  }
  std::vector<bool> switched;
  std::function<void()> whenSwitched;
};

}  // namespace brenvik
