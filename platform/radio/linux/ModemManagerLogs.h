// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <memory>
#include <string>

#include "platform/radio/RadioManager.h"
#include "platform/runloop/WorkQueue.h"

namespace brenvik {

// ModemManager as the radio manager: "on" sets its log level to DEBUG, "off" puts back INFO, the level it
// starts with (ModemManager(8)); its log goes where its unit sends it. A manager that does not run is not
// started for this. It uses the bus on its own queue, at most one second for each switch; of the switches
// that are made meanwhile, only the last is carried out. Main loop only.
class ModemManagerLogs final : public RadioManager {
 public:
  // The defaults are the system bus, kPatience and the library of sd-bus; tests pass others. `queues` must
  // outlive this object.
  explicit ModemManagerLogs(WorkQueues& queues, std::string busAddress = kSystemBus,
                            std::chrono::milliseconds patience = kPatience, const char* library = kLibrary);
  ModemManagerLogs(const ModemManagerLogs&) = delete;
  ModemManagerLogs& operator=(const ModemManagerLogs&) = delete;
  // Waits for a call under way, up to one second.
  ~ModemManagerLogs() override;

  void setLogToFile(bool enable) noexcept override;

  // Fixed, so that nothing in the environment can point the helper elsewhere.
  static constexpr const char* kSystemBus = "unix:path=/run/dbus/system_bus_socket";
  // Loaded on the queue, at the first switch.
  static constexpr const char* kLibrary = "libsystemd.so.0";
  // The time limit of one switch: connecting, authenticating, the call and its answer.
  static constexpr std::chrono::milliseconds kPatience{1000};

 private:
  struct Switch;
  WorkQueues& queues_;
  const std::shared_ptr<Switch> switch_;
  std::shared_ptr<WorkQueue> queue_;  // made with the first use
};

}  // namespace brenvik
