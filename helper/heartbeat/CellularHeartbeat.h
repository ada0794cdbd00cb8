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

// Keeps the cellular data link awake: one ICMP echo request every two seconds by the interface pdp_ip0 while
// switched on, and a busy token held for as long. Nobody is told whether a request was answered.
class CellularHeartbeat {
 public:
  // What it works with; all of it outlives the heartbeat, or its shutDown().
  struct Parts {
    WorkQueues& queues;
    EchoNetwork& network;
    std::string address = kReachabilityAddress;
  };

  CellularHeartbeat() noexcept = default;
  CellularHeartbeat(const CellularHeartbeat&) = delete;
  CellularHeartbeat& operator=(const CellularHeartbeat&) = delete;
  // As shutDown().
  ~CellularHeartbeat();

  // The process's own, made before main() begins. It costs nothing until it is first switched on.
  static CellularHeartbeat& shared() noexcept;

  // To be called once, before anything else.
  void configure(Parts parts);

  // Switches it on or off, and returns at once. Main loop only; a server that was switched on for outlives
  // the heartbeat. Switched on twice, it takes a second token and forgets the first, which stays taken. Where
  // its timer cannot be armed it is off again, its token is given back, and a line says so.
  void setHeartbeat(ServerContext& server, bool enable);

  // Ends the queue after the probe that runs, which takes up to two seconds; tokens stay taken. Main loop
  // only.
  void shutDown() noexcept;

  // Whether it is on, and what went out and came back since the process began. Any thread.
  struct Traffic {
    std::uint64_t packets = 0;
    std::uint64_t bytes = 0;  // of ICMP messages
  };
  bool isOn() const noexcept { return isOn_.load(std::memory_order_relaxed); }
  Traffic sent() const noexcept { return sent_.read(); }
  Traffic received() const noexcept { return received_.read(); }

  // One probe, up to two seconds: sends a request and waits for its reply. 0, or what went wrong as an errno
  // number; ENOMEM when memory did not suffice. On the heartbeat's queue, or with none running.
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
  // Last, so that it ends first: its tasks use everything above.
  std::shared_ptr<WorkQueue> queue_;
};

}  // namespace brenvik
