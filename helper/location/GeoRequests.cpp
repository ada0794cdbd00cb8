// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/location/GeoRequests.h"

#include <utility>

#include "platform/log/Log.h"

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

}  // namespace brenvik
