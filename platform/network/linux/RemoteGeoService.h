// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/geo/GeoService.h"
#include "platform/geo/country/CountryConfiguration.h"
#include "platform/network/linux/NetworkAnswers.h"

namespace brenvik {

// The geo service, in the network worker. The country configuration, and the country of the last answer, are
// kept in this process. A question that the worker does not answer ends in an error.
class RemoteGeoService final : public GeoService {
 public:
  // The answers must outlive it or be shut down first. Cheap: opens nothing.
  RemoteGeoService(NetworkAnswers& answers, CountryConfiguration::Files countryFiles);

  std::unique_ptr<ReverseGeocodeTicket> makeReverseGeocodeTicket(Coordinate coordinate, IncludeEta includeEta,
                                                                 ShiftLocations shiftLocations,
                                                                 const GeoTraits* traits) override;
  std::unique_ptr<GeoIpTicket> makeGeoIpTicket(const std::optional<std::string>& ipAddress) override;
  std::optional<std::string> currentCountryCode() override;

 private:
  class ReverseTicket;
  class IpTicket;
  NetworkAnswers& answers_;
  const std::shared_ptr<CountryConfiguration> country_;
};

}  // namespace brenvik
