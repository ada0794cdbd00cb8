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

// The network worker's side of a channel. What the helper asks for is as foreign here as an answer is there:
// a malformed question closes its channel. Any thread.
class NetworkServing {
 public:
  // Channels that are served at a time, on a thread each: twice what the helper keeps open of any sort.
  // Further ones are refused.
  static constexpr int kMaxChannels = 64;

  // What it works with; all of it outlives it. The client's bodies are for another process (WebBody).
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

  // Serves a channel on a thread of its own, and returns at once. This object outlives all of them.
  void start(std::uint32_t work, WorkerChannel channel) noexcept;

  // Waits until start() serves nothing any more.
  void waitUntilIdle() const noexcept;

  // Serves it here: returns when the work is done or the channel has hung up.
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
