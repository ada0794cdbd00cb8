// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/network/linux/RemoteGeoService.h"

#include <chrono>
#include <new>
#include <utility>

#include "platform/network/GeoMessages.h"
#include "platform/network/linux/LargeMessage.h"

namespace brenvik {
namespace {

// Four seconds until its turn and ten for a server, or eight for a STUN transaction; and as much again as a
// busy machine may need.
constexpr std::chrono::seconds kLongestLookUp{20};

constexpr const char* kNoWorker = "the network worker is not available";
constexpr const char* kNoRoom = "the geo service has no thread or memory to work with";

// Puts the answer on the queue that the question named, if that still exists.
template <typename Handler, typename Answer>
void answerOn(const std::weak_ptr<WorkQueue>& queue, const Handler& handler, GeoOutcome<Answer> outcome) {
  const auto alive = queue.lock();
  if (alive == nullptr) return;
  alive->post([handler, outcome = std::move(outcome)] { handler(outcome.answer, outcome.error); });
}

// What the worker's answer comes to; `makesSense` is false of one that it should not give.
template <typename Answer, typename Decode>
GeoOutcome<Answer> outcomeOf(NetworkAnswers::Ended ended, WorkerMessage* answer, Decode decode,
                             bool& makesSense) {
  if (answer == nullptr) return {{}, GeoError{ended == NetworkAnswers::Ended::refused ? kNoRoom : kNoWorker}};
  const auto opened = LargePayload::open(std::move(*answer));
  if (opened) {
    if (auto outcome = decode(opened->bytes())) return *std::move(outcome);
  }
  makesSense = false;
  return {{}, GeoError{kNoWorker}};
}

WorkerMessage askWith(std::vector<std::byte> payload) {
  return {static_cast<std::uint32_t>(NetworkMessage::ask), std::move(payload), {}};
}

}  // namespace

class RemoteGeoService::ReverseTicket final : public ReverseGeocodeTicket {
 public:
  ReverseTicket(RemoteGeoService& service, Coordinate coordinate)
      : service_(service), coordinate_(coordinate) {}
  void submit(ReverseGeocodeHandler handler, const GeoNetworkActivity*,
              const std::shared_ptr<WorkQueue>& handlerQueue) override {
    service_.answers_.ask(NetworkWork::reverseGeocode, askWith(encode(coordinate_)), kLongestLookUp,
                          [handler = std::move(handler), queue = std::weak_ptr(handlerQueue),
                           country = service_.country_](NetworkAnswers::Ended ended, WorkerMessage* answer) {
                            if (ended == NetworkAnswers::Ended::cancelled) return true;
                            bool makesSense = true;
                            auto outcome = outcomeOf<MapItems>(ended, answer, decodeMapItems, makesSense);
                            if (const auto code = countryIn(outcome)) country->setLastGeocoded(*code);
                            answerOn(queue, handler, std::move(outcome));
                            return makesSense;
                          });
  }

 private:
  static std::optional<std::string> countryIn(const GeoOutcome<MapItems>& outcome) {
    if (!outcome.answer || outcome.answer->empty()) return std::nullopt;
    const auto& item = outcome.answer->front();
    if (!item || !item->address || !item->address->structuredAddress) return std::nullopt;
    return item->address->structuredAddress->countryCode;
  }
  RemoteGeoService& service_;
  const Coordinate coordinate_;
};

class RemoteGeoService::IpTicket final : public GeoIpTicket {
 public:
  IpTicket(RemoteGeoService& service, bool ofThisDevice) : service_(service), ofThisDevice_(ofThisDevice) {}
  void submit(GeoIpHandler handler, const AuditToken*, const GeoNetworkActivity*,
              const std::shared_ptr<WorkQueue>& handlerQueue) override {
    const std::weak_ptr queue(handlerQueue);
    if (!ofThisDevice_) {
      return answerOn(
          queue, handler,
          GeoOutcome<GeoIpResult>{{}, GeoError{"only this device's own address can be looked up"}});
    }
    service_.answers_.ask(
        NetworkWork::publicAddress, askWith({}), kLongestLookUp,
        [handler = std::move(handler), queue](NetworkAnswers::Ended ended, WorkerMessage* answer) {
          if (ended == NetworkAnswers::Ended::cancelled) return true;
          bool makesSense = true;
          answerOn(queue, handler, outcomeOf<GeoIpResult>(ended, answer, decodeGeoIpResult, makesSense));
          return makesSense;
        });
  }

 private:
  RemoteGeoService& service_;
  const bool ofThisDevice_;
};

RemoteGeoService::RemoteGeoService(NetworkAnswers& answers, CountryConfiguration::Files countryFiles)
    : answers_(answers), country_(std::make_shared<CountryConfiguration>(std::move(countryFiles))) {}

std::unique_ptr<ReverseGeocodeTicket> RemoteGeoService::makeReverseGeocodeTicket(Coordinate coordinate,
                                                                                 IncludeEta, ShiftLocations,
                                                                                 const GeoTraits*) {
  // No route is planned here, and no source has coordinates that would have to be shifted.
  return std::make_unique<ReverseTicket>(*this, coordinate);
}

std::unique_ptr<GeoIpTicket> RemoteGeoService::makeGeoIpTicket(const std::optional<std::string>& ipAddress) {
  return std::make_unique<IpTicket>(*this, !ipAddress.has_value());
}

std::optional<std::string> RemoteGeoService::currentCountryCode() { return country_->countryCode(); }

}  // namespace brenvik
