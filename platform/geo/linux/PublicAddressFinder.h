// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <functional>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/geo/linux/StunTransaction.h"
#include "platform/runloop/WorkQueue.h"

namespace brenvik {

// Finds this device's public address. Each question starts a STUN transaction at once, on a queue of its own.
// If kMaxTransactions are under way, or there is no thread for another, the question shares the transaction
// that began last.
class PublicAddressFinder : public std::enable_shared_from_this<PublicAddressFinder> {
 public:
  // A transaction takes at most eight seconds, usually a fraction of one. Only a flood of requests needs
  // more, and it must not cause a flood of datagrams.
  static constexpr std::size_t kMaxTransactions = 4;

  // Called on a queue of the finder's.
  using Deliver = std::function<void(const StunOutcome&)>;
  // Makes the network of one transaction. Its waits end when `stopFd` becomes readable. Any thread.
  using MakeNetwork = std::function<std::unique_ptr<StunNetwork>(int stopFd)>;

  // The queues must outlive it or its stop(). Throws OutOfQueues if no descriptor is left.
  PublicAddressFinder(MakeNetwork makeNetwork, WorkQueues& queues);

  // Delivers the address, or an error, later. If no thread can be started, delivers an error within this
  // call. Any thread.
  void find(Deliver deliver);
  // Ends the running transactions and their threads; nothing is delivered afterwards. Do not call it on one
  // of the finder's queues.
  void stop() noexcept;

 private:
  struct Transaction {
    std::vector<Deliver> asked;
  };
  struct Worker {
    std::shared_ptr<WorkQueue> queue;
    bool isBusy = false;
  };

  Worker* idleWorker() noexcept;
  std::vector<Deliver> endOf(const Transaction& transaction, Worker& worker) noexcept;
  void run(const Transaction& transaction, Worker& worker);
  StunOutcome outcome();

  const MakeNetwork makeNetwork_;
  WorkQueues& queues_;
  const UniqueFd stopFd_;
  std::mutex mutex_;                                   // guards the rest
  std::vector<std::unique_ptr<Transaction>> running_;  // in the order they began
  bool stopped_ = false;
  std::array<Worker, kMaxTransactions> workers_;  // made as they are needed, and kept
};

}  // namespace brenvik
