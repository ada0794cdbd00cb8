// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>
#include <vector>

#include "platform/servicemanager/ServiceManager.h"

namespace brenvik {

class RecordingServiceManager final : public ServiceManager {
 public:
  bool listens() const noexcept override { return isListening; }
  void show(const std::string& line) noexcept override { lines.push_back(line); }

  bool isListening = true;
  std::vector<std::string> lines;
};

}  // namespace brenvik
