// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

#include "Helper/Shared/Server/BusyTokens.h"
#include "platform/net/EchoNetwork.h"
#include "platform/runloop/WorkQueue.h"

namespace brenvik {

// The destination compiled in, an IPv4 address in dotted-decimal form.
extern const char* const kReachabilityAddress;

// Keeps the cellular data link awake: while it is on, it sends one ICMP echo request every two seconds over
// the interface pdp_ip0 and holds a busy token. Nobody is told whether a request was answered.
class CellularHeartbeat {
 public:
  // The heartbeat's dependencies, which must outlive it or its shutDown().
  struct Parts {
    WorkQueues& queues;
    EchoNetwork& network;
    std::string address = kReachabilityAddress;
  };

  CellularHeartbeat() noexcept = default;
  CellularHeartbeat(const CellularHeartbeat&) = delete;
  CellularHeartbeat& operator=(const CellularHeartbeat&) = delete;
  // Does what shutDown() does.
  ~CellularHeartbeat();

  // The process's own heartbeat, made before main() begins. It costs nothing until it is first switched on.
  static CellularHeartbeat& shared() noexcept;

  // Call it once, before anything else.
  void configure(Parts parts);

  // Switches it on or off, and returns at once. Main loop only; the server must outlive the heartbeat. If it
  // is switched on twice, it takes a second token and forgets the first, which stays taken. If its timer
  // cannot be armed, it logs that, switches itself off and gives the token back.
  void setHeartbeat(ServerContext& server, bool enable);

  // Waits for the probe that is running (up to two seconds) and ends the queue; tokens stay taken. Main loop
  // only.
  void shutDown() noexcept;

  // Whether it is on, and the packets sent and received since the process began. Any thread.
  struct Traffic {
    std::uint64_t packets = 0;
    std::uint64_t bytes = 0;  // of ICMP messages
  };
  bool isOn() const noexcept { return isOn_.load(std::memory_order_relaxed); }
  Traffic sent() const noexcept { return sent_.read(); }
  Traffic received() const noexcept { return received_.read(); }

  // Sends one request and waits for its reply, up to two seconds. Returns 0 or an errno; ENOMEM if memory ran
  // out. Call it on the heartbeat's queue, or while that has no tasks.
  int ping() noexcept;

 private:
  void start(ServerContext& server);
  void stop(ServerContext& server);

  // One writer; readers may see a packet whose bytes are not counted yet.
  class Counter {
   public:
    void add(std::size_t bytes) noexcept {
      packets_.fetch_add(1, std::memory_order_relaxed);
      bytes_.fetch_add(bytes, std::memory_order_relaxed);
    }
    Traffic read() const noexcept {
      return {packets_.load(std::memory_order_relaxed), bytes_.load(std::memory_order_relaxed)};
    }

   private:
    std::atomic<std::uint64_t> packets_{0};
    std::atomic<std::uint64_t> bytes_{0};
  };
  std::atomic<bool> isOn_{false};
  Counter sent_;
  Counter received_;

  std::unique_ptr<Parts> parts_;
  // Below: on the queue only.
  std::unique_ptr<WorkQueue::Timer> timer_;
  std::uint32_t busyToken_ = 0;
  ServerContext* server_ = nullptr;
  // Declared last, so that it is destroyed first: its tasks use everything above.
  std::shared_ptr<WorkQueue> queue_;
};

}  // namespace brenvik
