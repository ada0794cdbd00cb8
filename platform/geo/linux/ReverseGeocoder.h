// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/geo/GeoService.h"
#include "platform/geo/linux/Gazetteer.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/web/WebClient.h"

namespace brenvik {

// The time limit from sending a request to the end of its answer.
inline constexpr std::chrono::seconds kGeocoderPatience{10};
// The pause between two requests. Public servers ask their users for one second; a private server may need
// none.
inline constexpr std::chrono::milliseconds kGeocoderPace{BRENVIK_GEOCODER_PACE};
// The longest that a request waits for its turn; after that the offline gazetteer answers.
inline constexpr std::chrono::seconds kLongestTurn{4};

// Finds the address at a coordinate: a Nominatim-compatible server, if there is one, and the offline
// gazetteer if there is none or it fails. Its work runs on one serial queue; answers are handed to `deliver`
// there.
class ReverseGeocoder : public std::enable_shared_from_this<ReverseGeocoder> {
 public:
  using Deliver = std::function<void(std::optional<MapItems>, std::optional<GeoError>)>;
  // Monotonic time, from any start.
  using Now = std::function<std::chrono::nanoseconds()>;

  // `serverUrl` empty: no server, and `webClient` is not used.
  ReverseGeocoder(std::string serverUrl, std::string gazetteerPath, WebClient& webClient, Now now,
                  std::chrono::milliseconds pace = kGeocoderPace)
      : serverUrl_(std::move(serverUrl)),
        webClient_(webClient),
        now_(std::move(now)),
        pace_(pace),
        gazetteer_(std::move(gazetteerPath)) {}

  // Answers later on `queue`, unless closed by then. The caller keeps the queue alive until the answer.
  void lookUp(Coordinate coordinate, Deliver deliver, const std::shared_ptr<WorkQueue>& queue);

  // Waits for a look-up that is running; afterwards nothing outside this object is used. Any thread.
  void close() noexcept;

 private:
  void ask(Coordinate coordinate, Deliver deliver, const std::shared_ptr<WorkQueue>& queue);
  void send(Coordinate coordinate, const Deliver& deliver, const std::shared_ptr<WorkQueue>& queue);
  void takeResponse(Coordinate coordinate, const Deliver& deliver,
                    const std::shared_ptr<WebResponse>& response);
  void answerOffline(Coordinate coordinate, const Deliver& deliver, const std::string& serverError);
  void deliverAddress(std::optional<StructuredAddress> address, const Deliver& deliver);

  const std::string serverUrl_;
  WebClient& webClient_;
  const Now now_;
  const std::chrono::milliseconds pace_;
  Gazetteer gazetteer_;
  std::chrono::nanoseconds nextTurn_{std::chrono::nanoseconds::min()};
  std::mutex atWork_;
  bool closed_ = false;  // under atWork_
};

}  // namespace brenvik
