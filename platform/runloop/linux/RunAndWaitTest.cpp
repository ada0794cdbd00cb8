// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/runloop/RunAndWait.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>

#include "platform/runloop/linux/SystemQueues.h"

namespace brenvik {
namespace {

// Passes tasks on to a real queue, once memory is there again.
class QueueShortOfMemory final : public WorkQueue {
 public:
  QueueShortOfMemory(WorkQueue& queue, int failures) : queue_(queue), failures_(failures) {}
  void post(Task task) override {
    if (failures_-- > 0) throw std::bad_alloc();
    queue_.post(std::move(task));
  }
  const std::string& label() const noexcept override { return queue_.label(); }
  void postAfter(std::chrono::nanoseconds, Task) override {}
  std::unique_ptr<Timer> makeTimer(std::chrono::nanoseconds, std::chrono::nanoseconds,
                                   std::chrono::nanoseconds, Task) override {
    return nullptr;
  }
  bool isCurrent() const noexcept override { return queue_.isCurrent(); }
  std::unique_ptr<DescriptorSource> watchDescriptor(int, Interest, RunLoop::DescriptorHandler) override {
    return nullptr;
  }

 private:
  WorkQueue& queue_;
  int failures_;
};

TEST(RunAndWaitTest, ComesBackWhenTheTaskIsDoneAndNotBefore) {
  const auto loop = SystemRunLoop::make();
  SystemQueues queues(*loop);
  const auto queue = queues.makeSerial("serial", QualityOfService::standard);
  for (const int failures : {0, 2}) {
    QueueShortOfMemory asked(*queue, failures);
    std::thread::id where;
    runAndWait(asked, [&] {
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
      where = std::this_thread::get_id();
    });
    EXPECT_NE(where, std::thread::id()) << failures;
    EXPECT_NE(where, std::this_thread::get_id()) << failures;
  }
}

}  // namespace
}  // namespace brenvik
