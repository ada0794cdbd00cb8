// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/location/GeoRequestState.h"

namespace brenvik {

GeoRequestState& GeoRequestState::shared() {
  static GeoRequestState state;
  return state;
}

std::shared_ptr<WorkQueue> GeoRequestState::geoCallbackQueue(WorkQueues& queues) {
  std::call_once(queueMade_,
                 [&] { queue_ = queues.makeSerial("GEO callback queue", QualityOfService::utility); });
  return queue_;
}

}  // namespace brenvik
