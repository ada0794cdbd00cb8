// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "helper/location/GeoRequestState.h"
#include "platform/geo/GeoService.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/telephony/TelephonyDaemonConnection.h"

namespace brenvik {

// The work behind the location routines; its queued tasks share ownership. A request is submitted to the geo
// service on the GEO callback queue. Its answer arrives on that queue, its time-out on the main queue. The
// first of them that finds an answer awaited pushes to the telephony daemon.
class GeoRequests : public std::enable_shared_from_this<GeoRequests> {
 public:
  // The references are not used after close() has returned.
  GeoRequests(WorkQueues& queues, GeoService& geoService, TelephonyDaemon& telephonyDaemon,
              GeoRequestState& state)
      : queues_(queues), geoService_(geoService), telephonyDaemon_(telephonyDaemon), state_(state) {}

  // Queues the work item of a request on the GEO callback queue. It runs without waiting for the main loop,
  // or not at all if close() comes first. Main loop.
  void dispatch(WorkQueue::Task workItem);

  // Waits for the task that is running on the GEO callback queue; no task starts afterwards. Main loop.
  void close() noexcept;

  // GEO callback queue only.
  void requestCivicInfoFromLatitudeLongitude(double latitude, double longitude);
  void requestWanIpFromLocation();

  // Returns the country configuration's code. If none is known, logs that and returns an empty text. Any
  // thread.
  std::string currentCountryCode();

 private:
  // The findings of a reverse-geocode request so far; the request and its handler share them.
  struct CivicInfo {
    std::string countryCode;
    std::string state;
    std::string city;
    std::string postalCode;
  };

  // Runs the task on the GEO callback queue, unless close() comes first. Any thread.
  void postToGeoCallbackQueue(WorkQueue::Task task);
  std::shared_ptr<WorkQueue> geoCallbackQueue() { return state_.geoCallbackQueue(queues_); }
  // Reads the flag once, clears it if it was set, and returns what it read.
  bool takeAwaitedResponse() noexcept;
  // Sets the flag and schedules the fallback on the main queue, five seconds from now.
  void awaitGeoResponse(void (GeoRequests::*fallback)());
  void postToMainQueue(void (GeoRequests::*step)());
  // Runs the push here, or, if this is the main queue, on the GEO callback queue.
  void pushOffMainQueue(WorkQueue::Task push);

  void handleMapItems(CivicInfo& info, const std::optional<MapItems>& items,
                      const std::optional<GeoError>& error);
  void takeFirstMapItem(CivicInfo& info, const std::optional<MapItems>& items,
                        const std::optional<GeoError>& error);
  void pushCivicFallback();
  void sendCivicInfoToBrenvik(const CivicInfo& info);

  void handleGeoIpResult(const std::optional<GeoIpResult>& result, const std::optional<GeoError>& error);
  void pushWanIpFallback();
  void sendWanIpToBrenvik(const std::string& address);

  WorkQueues& queues_;
  GeoService& geoService_;
  TelephonyDaemon& telephonyDaemon_;
  GeoRequestState& state_;
  std::mutex running_;  // held by each task of the GEO callback queue, so that close() can wait for it
  std::atomic<bool> closed_{false};
};

}  // namespace brenvik
