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

// The location routines. Each replies at once; the telephony daemon gets the result later, in a push. Main
// loop only, construction and destruction included.
class LocationRoutines {
 public:
  // The references must outlive this object. Cheap: opens nothing and starts no thread.
  LocationRoutines(WorkQueues& queues, GeoService& geoService, TelephonyDaemon& telephonyDaemon,
                   GeoRequestState& state);
  LocationRoutines(const LocationRoutines&) = delete;
  LocationRoutines& operator=(const LocationRoutines&) = delete;
  // Waits for the request work that is running (at most a second, while it talks to the telephony daemon) and
  // drops the rest.
  ~LocationRoutines();

  // 8683567: push the civic address of the coordinate (degrees). Always succeeds.
  KernelReturn requestCountryCodeFromLocation(PortName port, double latitude, double longitude);
  // 8683568: writes the current country code and fills all 64 bytes; a text of 64 bytes has no NUL.
  KernelReturn copyCountryCode(PortName port, char* countryCode);
  // 8683569: push this device's public address. Always succeeds.
  KernelReturn requestWanIPFromLocation(PortName port);

 private:
  // noexcept: a request that cannot be queued ends the process.
  void dispatchCivicInfoRequest(double latitude, double longitude) noexcept;
  void dispatchWanIpRequest() noexcept;

  const std::shared_ptr<GeoRequests> requests_;
};

}  // namespace brenvik
