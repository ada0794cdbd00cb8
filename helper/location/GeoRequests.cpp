// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/location/GeoRequests.h"

#include <utility>

#include "helper/location/BrenvikPush.h"
#include "platform/log/Log.h"
#include "platform/log/LogContext.h"

namespace brenvik {
namespace {

constexpr std::chrono::nanoseconds kGeoResponseTimeOut{5'000'000'000};

}  // namespace

void GeoRequests::dispatch(WorkQueue::Task workItem) { postToGeoCallbackQueue(std::move(workItem)); }

void GeoRequests::postToGeoCallbackQueue(WorkQueue::Task task) {
  geoCallbackQueue()->post([self = shared_from_this(), task = std::move(task)] {
    const std::lock_guard lock(self->running_);
    if (!self->closed_.load()) task();
  });
}

void GeoRequests::close() noexcept {
  const std::lock_guard lock(running_);
  closed_.store(true);
}

bool GeoRequests::takeAwaitedResponse() noexcept {
  if (!state_.isAwaitingGeoResponse()) return false;
  state_.setAwaitingGeoResponse(false);
  return true;
}

void GeoRequests::awaitGeoResponse(void (GeoRequests::*fallback)()) {
  state_.setAwaitingGeoResponse(true);
  queues_.main().postAfter(kGeoResponseTimeOut, [self = shared_from_this(), fallback] {
    // Tasks of the main queue and close() share a thread: looking is enough.
    if (self->closed_.load()) return;
    if (!self->takeAwaitedResponse()) return;
    self->state_.noteEnding(GeoRequestState::Ending::timedOut);
    (self.get()->*fallback)();
  });
}

void GeoRequests::postToMainQueue(void (GeoRequests::*step)()) {
  queues_.main().post([self = shared_from_this(), step] {
    if (!self->closed_.load()) (self.get()->*step)();
  });
}

void GeoRequests::pushOffMainQueue(WorkQueue::Task push) {
  // A telephony daemon that hangs costs a second, which the main loop, where every request is served, has not
  // got. The queue of the answers takes the waiting over, so pushes also keep the order they were decided in.
  if (queues_.main().isCurrent()) return postToGeoCallbackQueue(std::move(push));
  push();
}

std::string GeoRequests::currentCountryCode() {
  if (auto code = geoService_.currentCountryCode()) return *std::move(code);
  logBsd(SyslogPriority::error, "Didn't get valid country code from GeoService.\n");
  return {};
}

// ---- civic information ----

void GeoRequests::requestCivicInfoFromLatitudeLongitude(double latitude, double longitude) {
  auto info = std::make_shared<CivicInfo>();
  if (latitude == 0.0 && longitude == 0.0) {
    // A caller without a position sends zeros. Nothing is submitted, so no answer is awaited.
    postToMainQueue(&GeoRequests::pushCivicFallback);
    return;
  }
  const auto ticket = geoService_.makeReverseGeocodeTicket({latitude, longitude}, IncludeEta::no,
                                                           ShiftLocations::ifNeeded, nullptr);
  awaitGeoResponse(&GeoRequests::pushCivicFallback);
  ticket->submit(
      [self = shared_from_this(), info = std::move(info), context = LogScope::current()](
          const std::optional<MapItems>& items, const std::optional<GeoError>& error) {
        const LogScope scope(context);
        const std::lock_guard lock(self->running_);
        if (!self->closed_.load()) self->handleMapItems(*info, items, error);
      },
      nullptr, geoCallbackQueue());
}

void GeoRequests::handleMapItems(CivicInfo& info, const std::optional<MapItems>& items,
                                 const std::optional<GeoError>& error) {
  if (!takeAwaitedResponse()) {
    logBsd(SyslogPriority::error,
           "_RequestCivicInfoFromLatitudeLongitude wasn't waiting for response from GEO");
    return;
  }
  state_.noteEnding(error ? GeoRequestState::Ending::failed : GeoRequestState::Ending::answered);
  takeFirstMapItem(info, items, error);
  if (info.countryCode.empty()) info.countryCode = currentCountryCode();
  sendCivicInfoToBrenvik(info);
}

// Fills `info` as far as the answer goes.
void GeoRequests::takeFirstMapItem(CivicInfo& info, const std::optional<MapItems>& items,
                                   const std::optional<GeoError>& error) {
  // An error is told twice over: by its description, and by the line of an answer without items.
  if (error) {
    logBsd(SyslogPriority::error, "_RequestCivicInfoFromLatitudeLongitude error: (%s)",
           error->description.c_str());
  }
  if (error || !items || items->empty()) {
    logBsd(SyslogPriority::error, "_RequestCivicInfoFromLatitudeLongitude didn't get any mapItems\n");
    return;
  }
  logBsd(SyslogPriority::notice, "_RequestCivicInfoFromLatitudeLongitude mapItems: (%lu)",
         static_cast<unsigned long>(items->size()));
  const std::optional<MapItem>& item = items->front();
  if (!item || !item->valid) {
    logBsd(SyslogPriority::error, "_RequestCivicInfoLatitudeLongitude NULL mapItem \n");
    return;
  }
  if (!item->address || !item->address->structuredAddress) {
    logBsd(SyslogPriority::error,
           "_RequestCivicInfoLatitudeLongitude mapItem didn't get a structured address");
    return;
  }
  const StructuredAddress& address = *item->address->structuredAddress;
  if (address.countryCode) {
    logBsd(SyslogPriority::notice, "_RequestCivicInfoFromLatitudeLongitude country code: %s",
           address.countryCode->c_str());
    info.countryCode = *address.countryCode;
  }
  if (address.administrativeArea) {
    logBsd(SyslogPriority::notice, "_RequestCivicInfoFromLatitudeLongitude state: %s",
           address.administrativeArea->c_str());
    info.state = *address.administrativeArea;
  }
  if (address.locality) {
    logBsd(SyslogPriority::notice, "_RequestCivicInfoFromLatitudeLongitude city: %s",
           address.locality->c_str());
    info.city = *address.locality;
  }
  if (address.postCode) {
    logBsd(SyslogPriority::notice, "_RequestCivicInfoFromLatitudeLongitude postal code: %s",
           address.postCode->c_str());
    info.postalCode = *address.postCode;
  }
}

void GeoRequests::pushCivicFallback() {
  CivicInfo info;
  info.countryCode = currentCountryCode();
  pushOffMainQueue(
      [self = shared_from_this(), info = std::move(info)] { self->sendCivicInfoToBrenvik(info); });
}

void GeoRequests::sendCivicInfoToBrenvik(const CivicInfo& info) {
  const auto connection = openBrenvik(telephonyDaemon_);
  if (connection == nullptr) {
    logBsd(SyslogPriority::error, "sendCivicInfoToQV to Brenvik failed, could not open QVServerConnection");
    return;
  }
  const TelephonyResult result = connection->setCivicInfoBasedOnCurrentLocation(
      platformString(info.countryCode), platformString(info.state), platformString(info.city),
      platformString(info.postalCode));
  if (const std::int32_t code = errorCodeOf(result); code != 0) {
    logBsd(SyslogPriority::notice, "sendCivicInfoToQV failed civic info to Brenvik due to error: %d", code);
  } else {
    logBsd(SyslogPriority::notice, "sendCivicInfoToQV sent civic info to Brenvik successfully");
  }
}

// ---- the public address ----

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
