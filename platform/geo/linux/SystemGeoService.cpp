// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/SystemGeoService.h"

#include <chrono>
#include <utility>

#include "platform/geo/linux/PublicAddressFinder.h"
#include "platform/geo/linux/UdpStunNetwork.h"

namespace brenvik {
namespace {

constexpr const char* kNoQueue = "the geo service has no thread to work on";

// Puts the answer on the queue that the question named, if that still exists.
template <typename Handler, typename Answer>
void answerOn(const std::weak_ptr<WorkQueue>& queue, const Handler& handler, std::optional<Answer> answer,
              std::optional<GeoError> error) {
  const auto alive = queue.lock();
  if (alive == nullptr) return;
  alive->post([handler, answer = std::move(answer), error = std::move(error)] { handler(answer, error); });
}

}  // namespace

class SystemGeoService::ReverseTicket final : public ReverseGeocodeTicket {
 public:
  ReverseTicket(SystemGeoService& service, Coordinate coordinate)
      : service_(service), coordinate_(coordinate) {}
  void submit(ReverseGeocodeHandler handler, const GeoNetworkActivity*,
              const std::shared_ptr<WorkQueue>& handlerQueue) override {
    auto deliver = [handler = std::move(handler), handlerQueue = std::weak_ptr(handlerQueue)](
                       std::optional<MapItems> items, std::optional<GeoError> error) {
      answerOn(handlerQueue, handler, std::move(items), std::move(error));
    };
    try {
      const auto queue = service_.placesQueue();
      queue->post([geocoder = service_.geocoder_, coordinate = coordinate_, deliver,
                   weakQueue = std::weak_ptr(queue)] {
        if (const auto alive = weakQueue.lock()) geocoder->lookUp(coordinate, deliver, alive);
      });
    } catch (const OutOfQueues&) {
      deliver({}, GeoError{kNoQueue});
    }
  }

 private:
  SystemGeoService& service_;
  const Coordinate coordinate_;
};

class SystemGeoService::IpTicket final : public GeoIpTicket {
 public:
  IpTicket(SystemGeoService& service, bool ofThisDevice) : service_(service), ofThisDevice_(ofThisDevice) {}
  void submit(GeoIpHandler handler, const AuditToken*, const GeoNetworkActivity*,
              const std::shared_ptr<WorkQueue>& handlerQueue) override {
    auto deliver = [handler = std::move(handler),
                    handlerQueue = std::weak_ptr(handlerQueue)](const StunOutcome& found) {
      std::optional<GeoIpResult> result;
      if (found.address) result = GeoIpResult{*found.address};
      answerOn(handlerQueue, handler, std::move(result), found.error);
    };
    if (!ofThisDevice_) return deliver({{}, GeoError{"only this device's own address can be looked up"}});
    std::shared_ptr<PublicAddressFinder> finder;
    try {
      finder = service_.addressFinder();
    } catch (const OutOfQueues&) {
      return deliver({{}, GeoError{kNoQueue}});
    }
    finder->find(std::move(deliver));
  }

 private:
  SystemGeoService& service_;
  const bool ofThisDevice_;
};

SystemGeoService::SystemGeoService(WorkQueues& queues, WebClient& webClient, Settings settings)
    : queues_(queues),
      geocoder_(std::make_shared<ReverseGeocoder>(
          std::move(settings.geocoderUrl), std::move(settings.gazetteer), webClient,
          [] { return std::chrono::nanoseconds(std::chrono::steady_clock::now().time_since_epoch()); })),
      stunServer_(std::move(settings.stunServer)) {}

SystemGeoService::~SystemGeoService() {
  geocoder_->close();
  std::shared_ptr<WorkQueue> places;
  std::shared_ptr<PublicAddressFinder> finder;
  {
    const std::lock_guard lock(mutex_);
    places.swap(placesQueue_);
    finder.swap(addressFinder_);
  }
  // Threads are joined here and by the queue's end, without the lock.
  if (finder != nullptr) finder->stop();
}

std::shared_ptr<WorkQueue> SystemGeoService::placesQueue() {
  const std::lock_guard lock(mutex_);
  if (placesQueue_ == nullptr) {
    placesQueue_ = queues_.makeSerial("geo service: places", QualityOfService::standard);
  }
  return placesQueue_;
}

std::shared_ptr<PublicAddressFinder> SystemGeoService::addressFinder() {
  const std::lock_guard lock(mutex_);
  if (addressFinder_ == nullptr) {
    addressFinder_ = std::make_shared<PublicAddressFinder>(
        [server = stunServer_](int stopFd) { return std::make_unique<UdpStunNetwork>(server, stopFd); },
        queues_);
  }
  return addressFinder_;
}

std::unique_ptr<ReverseGeocodeTicket> SystemGeoService::makeReverseGeocodeTicket(Coordinate coordinate,
                                                                                 IncludeEta, ShiftLocations,
                                                                                 const GeoTraits*) {
  // No route is planned here, and neither source has coordinates that would have to be shifted.
  return std::make_unique<ReverseTicket>(*this, coordinate);
}

std::unique_ptr<GeoIpTicket> SystemGeoService::makeGeoIpTicket(const std::optional<std::string>& ipAddress) {
  return std::make_unique<IpTicket>(*this, !ipAddress.has_value());
}

}  // namespace brenvik
