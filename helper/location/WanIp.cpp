// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/location/BrenvikPush.h"
#include "helper/location/GeoRequests.h"
#include "platform/log/Log.h"
#include "platform/log/LogContext.h"

namespace brenvik {

void GeoRequests::requestWanIpFromLocation() {
  const auto ticket = geoService_.makeGeoIpTicket(std::nullopt);
  awaitGeoResponse(&GeoRequests::pushWanIpFallback);
  ticket->submit(
      [self = shared_from_this(), context = LogScope::current()](const std::optional<GeoIpResult>& result,
                                                                 const std::optional<GeoError>& error) {
        const LogScope scope(context);
        const std::lock_guard lock(self->running_);
        if (!self->closed_.load()) self->handleGeoIpResult(result, error);
      },
      nullptr, nullptr, geoCallbackQueue());
}

void GeoRequests::handleGeoIpResult(const std::optional<GeoIpResult>& result,
                                    const std::optional<GeoError>& error) {
  if (!takeAwaitedResponse()) {
    logUnified(LogLevel::standard, "_RequestWanIPFromLocation wasn't waiting for response from GEO");
    return;
  }
  state_.noteEnding(error ? GeoRequestState::Ending::failed : GeoRequestState::Ending::answered);
  if (error) {
    logUnified(LogLevel::error, "_RequestWanIPFromLocation error: (%s)", error->description.c_str());
    // Empty, but pushed: the telephony daemon learns that there is no address.
    sendWanIpToBrenvik("");
    return;
  }
  const std::string address = result ? result->ipAddress : std::string();
  logUnified(LogLevel::standard, "_RequestWanIPFromLocation WAN IP: %s", address.c_str());
  sendWanIpToBrenvik(address);
}

void GeoRequests::pushWanIpFallback() {
  pushOffMainQueue([self = shared_from_this()] { self->sendWanIpToBrenvik(""); });
}

void GeoRequests::sendWanIpToBrenvik(const std::string& address) {
  const auto connection = openBrenvik(telephonyDaemon_);
  if (connection == nullptr) {
    logUnified(LogLevel::error, "sendWanIPToQV to Brenvik failed, could not open QVServerConnection");
    return;
  }
  const TelephonyResult result = connection->setLocalRoutableAddress(platformString(address));
  if (const std::int32_t code = errorCodeOf(result); code != 0) {
    logUnified(LogLevel::error, "sendWanIPToQV failed WAN IP to Brenvik due to error: %d", code);
  } else {
    logUnified(LogLevel::standard, "sendWanIPToQV sent WAN IP to Brenvik successfully");
  }
}

}  // namespace brenvik
