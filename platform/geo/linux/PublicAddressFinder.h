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

// Finds the address under which this device is seen from outside. Each question has a STUN transaction of its
// own, which begins at once, on a queue of its own. Where there are kMaxTransactions already, or no thread
// for another one, a question shares the transaction that began last.
class PublicAddressFinder : public std::enable_shared_from_this<PublicAddressFinder> {
 public:
  // A transaction takes eight seconds at most, and a usual one a fraction of one: more come from a caller
  // that floods, and need not become a flood of datagrams.
  static constexpr std::size_t kMaxTransactions = 4;

  // Called on a queue of the finder's.
  using Deliver = std::function<void(const StunOutcome&)>;
  // Makes the network of one transaction, whose waiting ends when the descriptor becomes readable. Any
  // thread.
  using MakeNetwork = std::function<std::unique_ptr<StunNetwork>(int stopFd)>;

  // The queues outlive it, or its stop(). Throws OutOfQueues when no descriptor is left.
  PublicAddressFinder(MakeNetwork makeNetwork, WorkQueues& queues);

  // Any thread. An error where there is no thread at all; that comes from within the call.
  void find(Deliver deliver);
  // Ends the transactions that run and their threads; nothing is delivered from now on. Not on a queue of the
  // finder's.
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
