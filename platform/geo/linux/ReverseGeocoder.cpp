// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/ReverseGeocoder.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <new>
#include <utility>

#include "platform/geo/linux/GeocoderAnswer.h"
#include "platform/log/Log.h"
#include "platform/log/LogContext.h"

namespace brenvik {
namespace {

constexpr int kHttpOk = 200;

// Seven decimals: a centimetre, and no exponent for a server to misread.
std::string decimal(double degrees) {
  std::array<char, 32> text;
  const auto end =
      std::to_chars(text.data(), text.data() + text.size(), degrees, std::chars_format::fixed, 7).ptr;
  return {text.data(), end};
}

// What the parts of an address may take together in a push to the telephony daemon: a datagram of 65,536
// bytes holds them beside the message and the keys, with some room to spare.
constexpr std::size_t kMaxPushBytes = 65'000;

// In a binary property list: a byte a character, or UTF-16 for all of a text that is not ASCII.
std::size_t sizeInAPush(const std::string& text) {
  const auto units = [](char c) {
    const auto byte = static_cast<unsigned char>(c);
    return byte >= 0xF0 ? 2U : (byte & 0xC0U) == 0x80 ? 0U : 1U;
  };
  const bool isAscii = std::all_of(text.begin(), text.end(), [](char c) { return (c & 0x80) == 0; });
  if (isAscii) return text.size();
  std::size_t size = 0;
  for (const char c : text) size += 2 * units(c);
  return size;
}

// A part that does not fit any more counts as absent: without it the rest gets there.
void fitIntoAPush(StructuredAddress& address) {
  std::size_t taken = 0;
  for (auto* const part :
       {&address.countryCode, &address.postCode, &address.locality, &address.administrativeArea}) {
    if (!*part) continue;
    const std::size_t size = sizeInAPush(**part);
    if (size > kMaxPushBytes - taken) {
      part->reset();
    } else {
      taken += size;
    }
  }
}

bool isCoordinate(const Coordinate& coordinate) {
  // Written so that a NaN fails it.
  return coordinate.latitude >= -90 && coordinate.latitude <= 90 && coordinate.longitude >= -180 &&
         coordinate.longitude <= 180;
}

}  // namespace

void ReverseGeocoder::close() noexcept {
  const std::lock_guard lock(atWork_);
  closed_ = true;
}

void ReverseGeocoder::lookUp(Coordinate coordinate, Deliver deliver,
                             const std::shared_ptr<WorkQueue>& queue) {
  const std::lock_guard lock(atWork_);
  if (closed_) return;
  if (!isCoordinate(coordinate)) {
    deliver(std::nullopt, GeoError{"the coordinate is out of range"});
    return;
  }
  if (serverUrl_.empty()) return answerOffline(coordinate, deliver, {});
  ask(coordinate, std::move(deliver), queue);
}

void ReverseGeocoder::ask(Coordinate coordinate, Deliver deliver, const std::shared_ptr<WorkQueue>& queue) {
  const auto now = now_();
  const auto turn = std::max(now, nextTurn_);
  if (turn - now > kLongestTurn) return answerOffline(coordinate, deliver, "too many requests");
  nextTurn_ = turn + pace_;
  if (turn == now) return send(coordinate, deliver, queue);
  queue->postAfter(turn - now, [weak = weak_from_this(), coordinate, deliver = std::move(deliver),
                                weakQueue = std::weak_ptr(queue)] {
    const auto self = weak.lock();
    const auto queueAgain = weakQueue.lock();
    if (self == nullptr || queueAgain == nullptr) return;
    const std::lock_guard lock(self->atWork_);
    if (!self->closed_) self->send(coordinate, deliver, queueAgain);
  });
}

void ReverseGeocoder::send(Coordinate coordinate, const Deliver& deliver,
                           const std::shared_ptr<WorkQueue>& queue) {
  std::string url = serverUrl_;
  while (url.ends_with('/')) url.pop_back();
  url +=
      "/reverse?format=jsonv2&lat=" + decimal(coordinate.latitude) + "&lon=" + decimal(coordinate.longitude);
  const HeaderMap headers{{"Accept", "application/json"},
                          {"User-Agent", "BrenvikMobileHelper/" BRENVIK_VERSION}};
  const char* refusal = "its URL cannot be used";
  try {
    const auto request = webClient_.makeRequest(WebRequestType::get, url, headers, webClient_.makeSession());
    if (request != nullptr) {
      request->setTimeLimit(kGeocoderPatience);
      request->setLargestBody(kLargestGeocoderAnswer);
      request->setCallbackQueue(queue);
      request->setCompletion([weak = weak_from_this(), coordinate, deliver,
                              context = LogScope::current()](const std::shared_ptr<WebResponse>& response) {
        const LogScope scope(context);
        const auto self = weak.lock();
        if (self == nullptr) return;
        const std::lock_guard lock(self->atWork_);
        if (!self->closed_) self->takeResponse(coordinate, deliver, response);
      });
      return request->send({});
    }
  } catch (const std::bad_alloc&) {
    refusal = "no memory or thread is left to ask it";
  }
  answerOffline(coordinate, deliver, refusal);
}

void ReverseGeocoder::takeResponse(Coordinate coordinate, const Deliver& deliver,
                                   const std::shared_ptr<WebResponse>& response) {
  if (response == nullptr) return answerOffline(coordinate, deliver, "nothing is known of it");
  if (response->errorKind != WebErrorKind::none) {
    return answerOffline(coordinate, deliver, textOfErrorKind(response->errorKind));
  }
  if (response->statusCode != kHttpOk) {
    return answerOffline(coordinate, deliver, textOfStatusCode(response->statusCode));
  }
  auto answer =
      readGeocoderAnswer({reinterpret_cast<const char*>(response->body.data()), response->body.size()});
  if (answer.error) return answerOffline(coordinate, deliver, answer.error->description);
  if (answer.address && answer.address->countryCode) {
    answer.address->countryCode = gazetteer_.ownCode(coordinate, *answer.address->countryCode);
  }
  deliverAddress(std::move(answer.address), deliver);
}

// `serverError` empty: there was no server to ask.
void ReverseGeocoder::answerOffline(Coordinate coordinate, const Deliver& deliver,
                                    const std::string& serverError) {
  auto answer = gazetteer_.lookUp(coordinate);
  if (answer.error) {
    if (!serverError.empty()) answer.error->description += "; the geocoder failed: " + serverError;
    deliver(std::nullopt, std::move(answer.error));
    return;
  }
  if (!serverError.empty()) {
    logUnified(LogLevel::standard, "geo service: the geocoder failed (%s), the offline gazetteer answers",
               serverError.c_str());
  }
  deliverAddress(std::move(answer.address), deliver);
}

void ReverseGeocoder::deliverAddress(std::optional<StructuredAddress> address, const Deliver& deliver) {
  MapItems items;
  if (address) {
    fitIntoAPush(*address);
    items.emplace_back(MapItem{true, GeoAddress{std::move(address)}});
  }
  deliver(std::move(items), std::nullopt);
}

}  // namespace brenvik
