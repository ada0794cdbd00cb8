// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/geo/linux/StunTransaction.h"
#include "platform/runloop/WorkQueue.h"

namespace brenvik {

// Finds the address under which this device is seen from outside, one STUN transaction at a time on a serial
// queue. Questions asked while a transaction runs share the next one, however many they are.
class PublicAddressFinder : public std::enable_shared_from_this<PublicAddressFinder> {
 public:
  // Called on the queue.
  using Deliver = std::function<void(const StunOutcome&)>;
  // Makes the network of one transaction, whose waiting ends when the descriptor becomes readable.
  using MakeNetwork = std::function<std::unique_ptr<StunNetwork>(int stopFd)>;

  // On the main queue no transaction runs: it waits. Throws OutOfQueues, here for want of a descriptor.
  PublicAddressFinder(MakeNetwork makeNetwork, WorkQueue& mainQueue);

  // Any thread. An error where the queue has no thread to start; that comes from within the call.
  void find(Deliver deliver, WorkQueue& queue);
  // Ends the transaction that runs; nothing is delivered from now on. Any thread.
  void stop() noexcept;

 private:
  void runTransaction();

  StunOutcome outcome();

  const MakeNetwork makeNetwork_;
  WorkQueue& mainQueue_;
  const UniqueFd stopFd_;
  std::mutex mutex_;
  std::vector<Deliver> waiting_;  // under mutex_
  bool stopped_ = false;          // under mutex_
};

}  // namespace brenvik
