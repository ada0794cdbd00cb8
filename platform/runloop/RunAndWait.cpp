// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/runloop/RunAndWait.h"

#include <chrono>
#include <new>
#include <semaphore>
#include <thread>

namespace brenvik {

void runAndWait(WorkQueue& queue, const WorkQueue::Task& work) noexcept {
  constexpr auto kPause = std::chrono::milliseconds(10);
  for (std::binary_semaphore done(0);;) {
    try {
      queue.post([&work, &done] {
        work();
        done.release();
      });
      return done.acquire();
    } catch (const std::bad_alloc&) {
      std::this_thread::sleep_for(kPause);
    }
  }
}

}  // namespace brenvik
