// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/runloop/WorkQueue.h"

namespace brenvik {

struct AuditToken;
class GeoTraits;           // the caller's preferences for an answer; not used here
class GeoNetworkActivity;  // the caller's activity that traffic is attributed to; not used here

// Degrees, north and east positive. Any numbers are possible; the service checks them.
struct Coordinate {
  double latitude = 0;
  double longitude = 0;
};

enum class IncludeEta { no, yes };
enum class ShiftLocations { no, ifNeeded };

// The parts of an address, UTF-8. A part the service does not know is absent.
struct StructuredAddress {
  std::optional<std::string> countryCode{};  // ISO 3166-1 alpha-2, upper case
  std::optional<std::string> administrativeArea{};
  std::optional<std::string> locality{};
  std::optional<std::string> postCode{};
};

struct GeoAddress {
  std::optional<StructuredAddress> structuredAddress;
};

// A place in an answer.
struct MapItem {
  bool valid = true;
  std::optional<GeoAddress> address;
};
using MapItems = std::vector<std::optional<MapItem>>;

struct GeoError {
  std::string description;  // for people, one line
};

struct GeoIpResult {
  std::string ipAddress;  // as text; empty: none
};

// Exactly one of answer and error is given; an answer without items means that nothing is known about the
// place.
using ReverseGeocodeHandler =
    std::function<void(const std::optional<MapItems>&, const std::optional<GeoError>&)>;
using GeoIpHandler = std::function<void(const std::optional<GeoIpResult>&, const std::optional<GeoError>&)>;

// A question that is prepared but not yet asked. It may be destroyed as soon as it is submitted.
class ReverseGeocodeTicket {
 public:
  virtual ~ReverseGeocodeTicket() = default;
  // Asks. The handler runs once, later, as a task of `handlerQueue`: never within this call, and not at all
  // if the queue is gone by then. Any thread; does not wait.
  virtual void submit(ReverseGeocodeHandler handler, const GeoNetworkActivity* networkActivity,
                      const std::shared_ptr<WorkQueue>& handlerQueue) = 0;
};

class GeoIpTicket {
 public:
  virtual ~GeoIpTicket() = default;
  // Asks, as ReverseGeocodeTicket::submit does.
  virtual void submit(GeoIpHandler handler, const AuditToken* auditToken,
                      const GeoNetworkActivity* networkActivity,
                      const std::shared_ptr<WorkQueue>& handlerQueue) = 0;
};

// Makes tickets for look-ups. Any thread. It must outlive its tickets; answers under way when it is destroyed
// are dropped.
class GeoTickets {
 public:
  virtual ~GeoTickets() = default;

  // A ticket for the address at a coordinate. Never null.
  virtual std::unique_ptr<ReverseGeocodeTicket> makeReverseGeocodeTicket(Coordinate coordinate,
                                                                         IncludeEta includeEta,
                                                                         ShiftLocations shiftLocations,
                                                                         const GeoTraits* traits) = 0;

  // A ticket for the facts about an IP address; absent: this device's public address. Never null.
  virtual std::unique_ptr<GeoIpTicket> makeGeoIpTicket(const std::optional<std::string>& ipAddress) = 0;
};

// The platform's geo service: the look-ups, and the country that this device is configured for.
class GeoService : public GeoTickets {
 public:
  // The country code of the shared country configuration, or nothing. Reads at most small files.
  virtual std::optional<std::string> currentCountryCode() = 0;
};

}  // namespace brenvik
