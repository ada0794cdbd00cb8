// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <functional>
#include <string>
#include <vector>

#include "Helper/Shared/Server/HelperServerUtils.h"
#include "helper/heartbeat/CellularHeartbeat.h"
#include "helper/lasd/LASDUpdater.h"
#include "helper/location/GeoRequestState.h"
#include "interface/status/Status.h"
#include "platform/base/Clock.h"
#include "platform/base/ProcessFacts.h"

namespace brenvik {

// The helper's report about itself, gathered for each request. Main loop only.
class HelperStatus {
 public:
  // The sources of the report; all must outlive this object.
  struct Sources {
    const ServerContext& server;
    const LASDUpdater& lasd;
    const CellularHeartbeat& heartbeat;
    const GeoRequestState& location;
    std::string version;
    std::string socket;  // of the service
    // The helper's worker processes, and whether each runs now.
    std::function<std::vector<StatusReport::Worker>()> workers = {};
    std::function<ProgramFacts()> program = programFacts;
    std::function<std::chrono::nanoseconds()> now = timeSinceBoot;
  };

  explicit HelperStatus(Sources sources) : sources_(std::move(sources)), began_(sources_.now()) {}

  StatusReport report() const;
  // One line for the service manager: what keeps the helper alive.
  std::string line() const;

 private:
  StatusReport::Event event(std::string outcome, std::chrono::nanoseconds when) const;

  const Sources sources_;
  const std::chrono::nanoseconds began_;
};

}  // namespace brenvik
