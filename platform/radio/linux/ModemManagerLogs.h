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
// started for this. The bus is spoken to on a queue of its own, for one second at most a switch; switching
// while that lasts is remembered, the last position only. Main loop only.
class ModemManagerLogs final : public RadioManager {
 public:
  // The bus is the system bus, the patience kPatience and the library that of sd-bus unless a test brings its
  // own. `queues` must outlive this object.
  explicit ModemManagerLogs(WorkQueues& queues, std::string busAddress = kSystemBus,
                            std::chrono::milliseconds patience = kPatience, const char* library = kLibrary);
  ModemManagerLogs(const ModemManagerLogs&) = delete;
  ModemManagerLogs& operator=(const ModemManagerLogs&) = delete;
  // Waits for a call under way: up to one second.
  ~ModemManagerLogs() override;

  void setLogToFile(bool enable) noexcept override;

  // Fixed, so that nothing in the environment can point the helper elsewhere.
  static constexpr const char* kSystemBus = "unix:path=/run/dbus/system_bus_socket";
  // Loaded with the first switch, on the queue.
  static constexpr const char* kLibrary = "libsystemd.so.0";
  // For everything that one switch does: connecting, authenticating, the call and its answer.
  static constexpr std::chrono::milliseconds kPatience{1000};

 private:
  struct Switch;
  WorkQueues& queues_;
  const std::shared_ptr<Switch> switch_;
  std::shared_ptr<WorkQueue> queue_;  // made with the first use
};

}  // namespace brenvik
