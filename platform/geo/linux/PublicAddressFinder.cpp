// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/PublicAddressFinder.h"

#include <sys/eventfd.h>
#include <sys/random.h>

#include <algorithm>
#include <new>
#include <utility>

namespace brenvik {
namespace {

constexpr const char* kNoThread = "the geo service has no thread to work on";
constexpr const char* kNoMemory = "out of memory";

}  // namespace

PublicAddressFinder::PublicAddressFinder(MakeNetwork makeNetwork, WorkQueues& queues)
    : makeNetwork_(std::move(makeNetwork)),
      queues_(queues),
      stopFd_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
  if (!stopFd_.isValid()) throw OutOfQueues();
}

// Under mutex_. Null where all are busy and no other can be had.
PublicAddressFinder::Worker* PublicAddressFinder::idleWorker() noexcept {
  for (Worker& worker : workers_) {
    if (worker.isBusy) continue;
    try {
      if (worker.queue == nullptr) {
        worker.queue = queues_.makeSerial("geo service: address", QualityOfService::standard);
      }
      return &worker;
    } catch (const std::bad_alloc&) {  // of memory, descriptors or threads
      return nullptr;
    }
  }
  return nullptr;
}

void PublicAddressFinder::find(Deliver deliver) {
  std::unique_lock lock(mutex_);
  if (stopped_) return;
  Worker* const worker = idleWorker();
  if (worker == nullptr && !running_.empty()) return running_.back()->asked.push_back(std::move(deliver));
  if (worker == nullptr) {
    lock.unlock();
    return deliver({{}, GeoError{kNoThread}});
  }
  auto made = std::make_unique<Transaction>();
  made->asked.push_back(std::move(deliver));
  Transaction& transaction = *made;
  running_.push_back(std::move(made));
  worker->isBusy = true;
  const auto queue = worker->queue;
  lock.unlock();
  try {
    queue->post([weak = weak_from_this(), &transaction, worker] {
      if (const auto self = weak.lock()) self->run(transaction, *worker);
    });
  } catch (const std::bad_alloc&) {
    // Nobody is left waiting for a transaction that will not run.
    for (const auto& asked : endOf(transaction, *worker)) asked({{}, GeoError{kNoThread}});
  }
}

void PublicAddressFinder::stop() noexcept {
  std::array<Worker, kMaxTransactions> workers;
  {
    const std::lock_guard lock(mutex_);
    stopped_ = true;
    for (std::size_t i = 0; i < workers.size(); ++i) workers[i].queue.swap(workers_[i].queue);
  }
  (void)::eventfd_write(stopFd_.get(), 1);  // its count is far from full
  // The queues join their threads here, without the lock.
}

// Whoever asked for the transaction, unless nothing is delivered any more.
std::vector<PublicAddressFinder::Deliver> PublicAddressFinder::endOf(const Transaction& transaction,
                                                                     Worker& worker) noexcept {
  const std::lock_guard lock(mutex_);
  worker.isBusy = false;
  const auto found = std::find_if(running_.begin(), running_.end(),
                                  [&](const auto& each) { return each.get() == &transaction; });
  auto asked = std::move((*found)->asked);
  running_.erase(found);
  if (stopped_) asked.clear();
  return asked;
}

void PublicAddressFinder::run(const Transaction& transaction, Worker& worker) {
  StunOutcome found;
  try {
    found = outcome();
  } catch (const std::bad_alloc&) {
    found = {{}, GeoError{kNoMemory}};
  }
  for (const auto& deliver : endOf(transaction, worker)) {
    try {
      deliver(found);
    } catch (const std::bad_alloc&) {
      // Whoever asked has a time-out; the others are to be told all the same.
    }
  }
}

StunOutcome PublicAddressFinder::outcome() {
  StunTransactionId id{};
  // An id that can be guessed would let anybody answer.
  if (::getrandom(id.data(), id.size(), 0) != static_cast<ssize_t>(id.size())) {
    return {{}, GeoError{"no random numbers"}};
  }
  return runStunTransaction(*makeNetwork_(stopFd_.get()), id);
}

}  // namespace brenvik
