// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/location/LocationRoutines.h"

#include <algorithm>
#include <cstring>

#include "helper/location/GeoRequests.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

struct CivicInfoRequestContext {
  double latitude;
  double longitude;
};

constexpr std::size_t kCountryCodeField = 64;

}  // namespace

LocationRoutines::LocationRoutines(WorkQueues& queues, GeoService& geoService,
                                   TelephonyDaemon& telephonyDaemon, GeoRequestState& state)
    : requests_(std::make_shared<GeoRequests>(queues, geoService, telephonyDaemon, state)) {}

LocationRoutines::~LocationRoutines() { requests_->close(); }

KernelReturn LocationRoutines::requestCountryCodeFromLocation(PortName, double latitude, double longitude) {
  logBsd(SyslogPriority::error, "server_BVMobileHelperRequestCountryCodeFromLocation \n");
  dispatchCivicInfoRequest(latitude, longitude);
  return kern::success;
}

KernelReturn LocationRoutines::copyCountryCode(PortName, char* countryCode) {
  const std::string text = requests_->currentCountryCode();
  // As strncpy does it: the rest is NUL, and a text that fills the field is cut without one.
  std::memset(countryCode, 0, kCountryCodeField);
  std::memcpy(countryCode, text.data(), ::strnlen(text.data(), std::min(text.size(), kCountryCodeField)));
  return kern::success;
}

KernelReturn LocationRoutines::requestWanIPFromLocation(PortName) {
  logUnified(LogLevel::debug, "server_BVMobileHelperRequestWanIPFromLocation");
  dispatchWanIpRequest();
  return kern::success;
}

void LocationRoutines::dispatchCivicInfoRequest(double latitude, double longitude) noexcept {
  const CivicInfoRequestContext context{latitude, longitude};
  requests_->dispatch([requests = requests_, context] {
    requests->requestCivicInfoFromLatitudeLongitude(context.latitude, context.longitude);
  });
}

void LocationRoutines::dispatchWanIpRequest() noexcept {
  requests_->dispatch([requests = requests_] { requests->requestWanIpFromLocation(); });
}

}  // namespace brenvik
