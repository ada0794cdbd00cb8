// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>

#include "interface/Wire.h"
#include "platform/geo/GeoService.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/telephony/TelephonyDaemonConnection.h"

namespace brenvik {

class GeoRequestState;
class GeoRequests;

// The location routines. Each answers at once; what was asked for reaches the telephony daemon later, in a
// push of its own. Main loop only, its construction and destruction included.
class LocationRoutines {
 public:
  // The references outlive this object. Cheap: nothing is opened, and no thread is started.
  LocationRoutines(WorkQueues& queues, GeoService& geoService, TelephonyDaemon& telephonyDaemon,
                   GeoRequestState& state);
  LocationRoutines(const LocationRoutines&) = delete;
  LocationRoutines& operator=(const LocationRoutines&) = delete;
  // Waits for the request work that runs at this moment (a second at most, while it talks to the telephony
  // daemon) and drops the rest.
  ~LocationRoutines();

  // 8683567: push the civic address of the coordinate (degrees). Always succeeds.
  KernelReturn requestCountryCodeFromLocation(PortName port, double latitude, double longitude);
  // 8683568: the current country code; all 64 bytes are written, and a text that fills them has no NUL.
  KernelReturn copyCountryCode(PortName port, char* countryCode);
  // 8683569: push the address under which this device is seen from outside. Always succeeds.
  KernelReturn requestWanIPFromLocation(PortName port);

 private:
  // noexcept: a request that cannot be queued ends the process.
  void dispatchCivicInfoRequest(double latitude, double longitude) noexcept;
  void dispatchWanIpRequest() noexcept;

  const std::shared_ptr<GeoRequests> requests_;
};

}  // namespace brenvik
