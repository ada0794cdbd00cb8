// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>

#include "platform/network/NetworkWork.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/worker/Worker.h"

namespace brenvik {

// Asks the network worker and waits for its answers, all on one queue of its own, which is made with the
// first question. A worker that dies, says nothing for too long or talks nonsense is given up, and the
// question has no answer. Any thread.
class NetworkAnswers {
 public:
  // Questions of one sort that the worker has at a time; further ones wait here for their turn. As many as a
  // reverse geocoder at its pace can leave open, and far fewer than there are descriptors.
  static constexpr std::size_t kMaxOpen = 24;

  enum class Ended {
    answered,
    refused,      // the worker, or this process, has no memory, thread or descriptor for it
    unavailable,  // there is no worker, or none any more
    cancelled,    // shutDown() came first
  };
  // Called once for each question: with the message when it was answered, else with null. On the queue of
  // this object, or from within ask() or shutDown(); never under a lock. Returns false when the answer is
  // nonsense.
  using Handler = std::function<bool(Ended, WorkerMessage*)>;

  // The queues and the worker outlive it, or its shutDown().
  NetworkAnswers(WorkQueues& queues, Worker& worker,
                 std::chrono::milliseconds longestSilence = kLongestSilence);
  NetworkAnswers(const NetworkAnswers&) = delete;
  NetworkAnswers& operator=(const NetworkAnswers&) = delete;
  ~NetworkAnswers();

  // Names a question, as long as that has not ended.
  using Token = std::weak_ptr<const void>;

  // Returns at once. A question that has no answer after `limit`, counted from when the worker has it, is not
  // waited for any longer.
  Token ask(NetworkWork work, WorkerMessage question, std::chrono::milliseconds limit,
            Handler handler) noexcept;

  // Ends the question as cancelled, a while later, unless it has ended by then.
  void cancel(const Token& token) noexcept;

  // Ends all questions as cancelled, and from now on every one at once. Not on this object's queue.
  void shutDown() noexcept;

 private:
  class Desk;
  const std::shared_ptr<Desk> desk_;
};

}  // namespace brenvik
