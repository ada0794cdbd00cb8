// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>

#include "platform/base/Clock.h"
#include "platform/runloop/WorkQueue.h"

namespace brenvik {

// The state that all geo requests of a process share: their queue, and whether an answer is awaited. Any
// thread.
class GeoRequestState {
 public:
  // The state of this process. Its queue, if any, is released at process exit.
  static GeoRequestState& shared();

  // The serial queue "GEO callback queue", made exactly once, on the first call.
  std::shared_ptr<WorkQueue> geoCallbackQueue(WorkQueues& queues);

  // True from a request's submission until the first answer or time-out of any request. Requests have no
  // identity: if several overlap, the first event does the work and the others are dropped.
  bool isAwaitingGeoResponse() const noexcept { return awaitingGeoResponse_.load(std::memory_order_relaxed); }
  void setAwaitingGeoResponse(bool awaiting) noexcept {
    awaitingGeoResponse_.store(awaiting, std::memory_order_relaxed);
  }

  // How the last request ended (the geo service's answer, its error, or neither in time), and when, by
  // timeSinceBoot(). It keeps nothing of the question or the answer.
  enum class Ending : std::uint8_t { answered, failed, timedOut };
  struct LastEnding {
    Ending ending = Ending::answered;
    std::chrono::nanoseconds when{0};
  };
  void noteEnding(Ending ending, std::chrono::nanoseconds now = timeSinceBoot()) noexcept {
    const std::lock_guard lock(endingMutex_);
    lastEnding_ = {ending, now};
  }
  std::optional<LastEnding> lastEnding() const noexcept {
    const std::lock_guard lock(endingMutex_);
    return lastEnding_;
  }

 private:
  mutable std::mutex endingMutex_;
  std::optional<LastEnding> lastEnding_;  // with endingMutex_
  std::once_flag queueMade_;
  std::shared_ptr<WorkQueue> queue_;
  // Relaxed and, deliberately, without an exchange: an event reads it once and clears it once, and it orders
  // nothing else.
  std::atomic<bool> awaitingGeoResponse_{false};
};

}  // namespace brenvik
