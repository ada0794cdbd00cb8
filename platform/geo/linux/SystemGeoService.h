// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/base/UniqueFd.h"
#include "platform/geo/GeoService.h"
#include "platform/geo/linux/ReverseGeocoder.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/web/WebClient.h"

namespace brenvik {

class PublicAddressFinder;

// The geo service's look-ups on Linux: addresses from a server or the offline gazetteer, the public address
// by STUN. It works on its own queues, each made with the first question that needs it: one for places, and
// one for each STUN transaction that runs at the same time.
class SystemGeoService final : public GeoTickets {
 public:
  struct Settings {
    std::string geocoderUrl;  // empty: none
    std::string gazetteer;    // path of the offline database
    std::string stunServer;   // host or host:port
  };

  // The references must outlive this object; the web client is used only if there is a geocoder. Cheap: opens
  // nothing.
  SystemGeoService(WorkQueues& queues, WebClient& webClient, Settings settings);
  SystemGeoService(const SystemGeoService&) = delete;
  SystemGeoService& operator=(const SystemGeoService&) = delete;
  // Ends the look-ups under way without an answer; does not wait for the network.
  ~SystemGeoService() override;

  std::unique_ptr<ReverseGeocodeTicket> makeReverseGeocodeTicket(Coordinate coordinate, IncludeEta includeEta,
                                                                 ShiftLocations shiftLocations,
                                                                 const GeoTraits* traits) override;
  std::unique_ptr<GeoIpTicket> makeGeoIpTicket(const std::optional<std::string>& ipAddress) override;

 private:
  class ReverseTicket;
  class IpTicket;
  // Throws OutOfQueues.
  std::shared_ptr<WorkQueue> placesQueue();
  // Throws OutOfQueues.
  std::shared_ptr<PublicAddressFinder> addressFinder();

  WorkQueues& queues_;
  const std::shared_ptr<ReverseGeocoder> geocoder_;
  const std::string stunServer_;
  std::mutex mutex_;
  std::shared_ptr<WorkQueue> placesQueue_;              // under mutex_
  std::shared_ptr<PublicAddressFinder> addressFinder_;  // under mutex_
};

}  // namespace brenvik
