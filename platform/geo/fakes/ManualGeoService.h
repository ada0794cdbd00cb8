// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/geo/GeoService.h"

namespace brenvik {

// A geo service that keeps every question and answers when, and in the order, a test says so: late, out of
// order, or never. One thread only.
class ManualGeoService final : public GeoService {
 public:
  // A question as it was asked.
  struct ReverseGeocode {
    Coordinate coordinate;
    IncludeEta includeEta;
    ShiftLocations shiftLocations;
    const GeoTraits* traits;
    const GeoNetworkActivity* networkActivity;
    std::weak_ptr<WorkQueue> handlerQueue;
    ReverseGeocodeHandler handler;

    void answer(std::optional<MapItems> items) { post(std::move(items), std::nullopt); }
    void fail(std::string description) { post(std::nullopt, GeoError{std::move(description)}); }
    void post(std::optional<MapItems> items, std::optional<GeoError> error) {
      if (const auto queue = handlerQueue.lock()) {
        queue->post(
            [call = handler, items = std::move(items), error = std::move(error)] { call(items, error); });
      }
    }
  };
  struct GeoIp {
    std::optional<std::string> ipAddress;
    const AuditToken* auditToken;
    const GeoNetworkActivity* networkActivity;
    std::weak_ptr<WorkQueue> handlerQueue;
    GeoIpHandler handler;

    void answer(std::string address) { post(GeoIpResult{std::move(address)}, std::nullopt); }
    void fail(std::string description) { post(std::nullopt, GeoError{std::move(description)}); }
    void post(std::optional<GeoIpResult> result, std::optional<GeoError> error) {
      if (const auto queue = handlerQueue.lock()) {
        queue->post(
            [call = handler, result = std::move(result), error = std::move(error)] { call(result, error); });
      }
    }
  };

  std::unique_ptr<ReverseGeocodeTicket> makeReverseGeocodeTicket(Coordinate coordinate, IncludeEta includeEta,
                                                                 ShiftLocations shiftLocations,
                                                                 const GeoTraits* traits) override {
    return std::make_unique<ReverseTicket>(
        *this, ReverseGeocode{coordinate, includeEta, shiftLocations, traits, nullptr, {}, {}});
  }
  std::unique_ptr<GeoIpTicket> makeGeoIpTicket(const std::optional<std::string>& ipAddress) override {
    return std::make_unique<IpTicket>(*this, GeoIp{ipAddress, nullptr, nullptr, {}, {}});
  }
  std::optional<std::string> currentCountryCode() override {
    ++countryCodeQuestions;
    return countryCode;
  }

  std::deque<ReverseGeocode> reverseGeocodes;  // submitted, in order
  std::deque<GeoIp> geoIps;
  std::optional<std::string> countryCode;
  int countryCodeQuestions = 0;
  int ticketsAlive = 0;

 private:
  class ReverseTicket final : public ReverseGeocodeTicket {
   public:
    ReverseTicket(ManualGeoService& service, ReverseGeocode question)
        : service_(service), question_(std::move(question)) {
      ++service_.ticketsAlive;
    }
    ~ReverseTicket() override { --service_.ticketsAlive; }
    void submit(ReverseGeocodeHandler handler, const GeoNetworkActivity* networkActivity,
                const std::shared_ptr<WorkQueue>& handlerQueue) override {
      question_.handler = std::move(handler);
      question_.networkActivity = networkActivity;
      question_.handlerQueue = handlerQueue;
      service_.reverseGeocodes.push_back(std::move(question_));
    }

   private:
    ManualGeoService& service_;
    ReverseGeocode question_;
  };
  class IpTicket final : public GeoIpTicket {
   public:
    IpTicket(ManualGeoService& service, GeoIp question) : service_(service), question_(std::move(question)) {
      ++service_.ticketsAlive;
    }
    ~IpTicket() override { --service_.ticketsAlive; }
    void submit(GeoIpHandler handler, const AuditToken* auditToken, const GeoNetworkActivity* networkActivity,
                const std::shared_ptr<WorkQueue>& handlerQueue) override {
      question_.handler = std::move(handler);
      question_.auditToken = auditToken;
      question_.networkActivity = networkActivity;
      question_.handlerQueue = handlerQueue;
      service_.geoIps.push_back(std::move(question_));
    }

   private:
    ManualGeoService& service_;
    GeoIp question_;
  };
};

}  // namespace brenvik
