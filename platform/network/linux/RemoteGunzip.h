// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

#include "platform/base/UniqueFd.h"
#include "platform/gzip/Gunzip.h"
#include "platform/network/GunzipMessages.h"
#include "platform/network/NetworkWork.h"
#include "platform/worker/Worker.h"

namespace brenvik {

// Gunzip in the network worker, which gets the file's descriptor. The caller's thread waits as long as the
// worker sends signs of life.
class RemoteGunzip final : public Gunzip {
 public:
  // The worker must outlive it.
  explicit RemoteGunzip(Worker& worker, std::chrono::milliseconds longestSilence = kLongestSilence) noexcept;

  GunzipOutcome gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                           std::uint64_t largestOutput) noexcept override;

  // Ends the work under way as `unavailable`; later calls end so at once. Any thread.
  void shutDown() noexcept;

 private:
  GunzipOutcome awaitOutcome(const GunzipQuestion& question, WorkerChannel& channel);

  Worker& worker_;
  const std::chrono::milliseconds longestSilence_;
  const UniqueFd stop_;  // readable once shut down
};

}  // namespace brenvik
