// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/PublicAddressFinder.h"

#include <sys/eventfd.h>
#include <sys/random.h>

#include <new>
#include <utility>

namespace brenvik {
namespace {

constexpr const char* kNoThread = "no thread to wait on";
constexpr const char* kNoMemory = "out of memory";

}  // namespace

PublicAddressFinder::PublicAddressFinder(MakeNetwork makeNetwork, WorkQueue& mainQueue)
    : makeNetwork_(std::move(makeNetwork)),
      mainQueue_(mainQueue),
      stopFd_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
  if (!stopFd_.isValid()) throw OutOfQueues();
}

void PublicAddressFinder::find(Deliver deliver, WorkQueue& queue) {
  {
    const std::lock_guard lock(mutex_);
    waiting_.push_back(std::move(deliver));
    // The transaction posted for the first of them takes all.
    if (waiting_.size() > 1) return;
  }
  try {
    queue.post([weak = weak_from_this()] {
      if (const auto self = weak.lock()) self->runTransaction();
    });
  } catch (const std::bad_alloc&) {  // of memory, or of threads
    // Nobody is left waiting for a transaction that will not run: the next question has to post one.
    std::vector<Deliver> asked;
    {
      const std::lock_guard lock(mutex_);
      asked.swap(waiting_);
    }
    for (const auto& each : asked) each({{}, GeoError{kNoThread}});
  }
}

void PublicAddressFinder::stop() noexcept {
  {
    const std::lock_guard lock(mutex_);
    stopped_ = true;
    waiting_.clear();
  }
  (void)::eventfd_write(stopFd_.get(), 1);  // its count is far from full
}

void PublicAddressFinder::runTransaction() {
  std::vector<Deliver> asked;
  {
    const std::lock_guard lock(mutex_);
    if (stopped_) return;
    asked.swap(waiting_);
  }
  StunOutcome found;
  try {
    found = outcome();
  } catch (const std::bad_alloc&) {
    found = {{}, GeoError{kNoMemory}};
  }
  {
    const std::lock_guard lock(mutex_);
    if (stopped_) return;
  }
  for (const auto& deliver : asked) {
    try {
      deliver(found);
    } catch (const std::bad_alloc&) {
      // Whoever asked has a time-out; the others are to be told all the same.
    }
  }
}

StunOutcome PublicAddressFinder::outcome() {
  if (mainQueue_.isCurrent()) return {{}, GeoError{kNoThread}};
  StunTransactionId id{};
  // An id that can be guessed would let anybody answer.
  if (::getrandom(id.data(), id.size(), 0) != static_cast<ssize_t>(id.size())) {
    return {{}, GeoError{"no random numbers"}};
  }
  return runStunTransaction(*makeNetwork_(stopFd_.get()), id);
}

}  // namespace brenvik
