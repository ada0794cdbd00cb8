// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>

#include "platform/geo/GeoService.h"
#include "platform/gzip/linux/ZlibGunzip.h"
#include "platform/net/EchoNetwork.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/web/WebClient.h"
#include "platform/worker/WorkerChannel.h"

namespace brenvik {

// The network worker's side of a channel. It checks the helper's questions as strictly as the helper checks
// its answers: a malformed question closes the channel. Any thread.
class NetworkServing {
 public:
  // The most channels that are served at a time, each on its own thread: twice what the helper keeps open of
  // any kind. Others are refused.
  static constexpr int kMaxChannels = 64;

  // Its dependencies, which must outlive it. The client's bodies are for another process (WebBody).
  struct Parts {
    WorkQueues& queues;
    WebClient& web;
    GeoTickets& geo;
    EchoNetwork& echo;
  };

  // Throws OutOfQueues.
  explicit NetworkServing(const Parts& parts);
  NetworkServing(const NetworkServing&) = delete;
  NetworkServing& operator=(const NetworkServing&) = delete;

  // Serves a channel on a thread of its own, and returns at once. This object must outlive those threads.
  void start(std::uint32_t work, WorkerChannel channel) noexcept;

  // Waits until no channel of start() is being served.
  void waitUntilIdle() const noexcept;

  // Serves a channel on this thread; returns when the work is done or the channel has hung up.
  void serve(std::uint32_t work, WorkerChannel channel) noexcept;

 private:
  void serveWeb(WorkerChannel& channel);
  void serveGunzip(WorkerChannel& channel);
  void serveReverseGeocode(WorkerChannel& channel);
  void servePublicAddress(WorkerChannel& channel);
  void serveEcho(WorkerChannel& channel);

  const Parts parts_;
  const std::shared_ptr<WorkQueue> answers_;  // where answers arrive
  ZlibGunzip gunzip_;
  std::atomic<int> served_{0};
};

}  // namespace brenvik
