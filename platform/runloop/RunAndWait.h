// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <new>
#include <semaphore>
#include <thread>

#include "platform/runloop/WorkQueue.h"

namespace brenvik {

// Runs the task on the queue, after the tasks posted before, and returns when it is done. While memory is
// short it tries again: whoever calls this cannot go on without. Not on the queue itself. The task does not
// throw.
template <class Task>
void runAndWait(WorkQueue& queue, const Task& task) noexcept {
  for (std::binary_semaphore done(0);;) {
    try {
      queue.post([&task, &done] {
        task();
        done.release();
      });
      return done.acquire();
    } catch (const std::bad_alloc&) {
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
  }
}

}  // namespace brenvik
