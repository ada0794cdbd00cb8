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

// Asks the network worker and waits for its answers on a queue of its own, which is made with the first
// question. If the worker dies, is silent for too long or sends malformed data, it is given up and the
// question gets no answer. Any thread.
class NetworkAnswers {
 public:
  // The most questions of one kind that the worker has at a time; others wait here for their turn. That is as
  // many as a reverse geocoder at its pace can leave open, and far fewer than there are descriptors.
  static constexpr std::size_t kMaxOpen = 24;

  enum class Ended {
    answered,
    refused,      // the worker, or this process, has no memory, thread or descriptor for it
    unavailable,  // there is no worker, or it has died
    cancelled,    // shutDown() came first
  };
  // Called once for each question, with the message if it was answered, else with null. Runs on this object's
  // queue, or within ask() or shutDown(); never under a lock. Returns false if the answer is malformed.
  using Handler = std::function<bool(Ended, WorkerMessage*)>;

  // The queues and the worker must outlive it or its shutDown().
  NetworkAnswers(WorkQueues& queues, Worker& worker,
                 std::chrono::milliseconds longestSilence = kLongestSilence);
  NetworkAnswers(const NetworkAnswers&) = delete;
  NetworkAnswers& operator=(const NetworkAnswers&) = delete;
  ~NetworkAnswers();

  // Identifies a question until it has ended.
  using Token = std::weak_ptr<const void>;

  // Returns at once. If there is no answer within `limit`, counted from when the worker gets the question,
  // the question ends without one.
  Token ask(NetworkWork work, WorkerMessage question, std::chrono::milliseconds limit,
            Handler handler) noexcept;

  // Ends the question as cancelled, some time later, unless it has ended by then.
  void cancel(const Token& token) noexcept;

  // Ends all questions as cancelled; later ones end at once. Do not call it on this object's queue.
  void shutDown() noexcept;

 private:
  class Desk;
  const std::shared_ptr<Desk> desk_;
};

}  // namespace brenvik
