// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/runloop/linux/SystemQueues.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <filesystem>
#include <fstream>
#include <future>
#include <iterator>
#include <limits>
#include <new>
#include <set>
#include <string>
#include <vector>

#include "platform/base/ProcessFacts.h"
#include "platform/log/Log.h"
#include "platform/log/LogContext.h"
#include "platform/log/fakes/RecordingLog.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
constexpr std::chrono::duration<double> kNoTimeOut{std::numeric_limits<double>::max()};

class SystemQueuesTest : public testing::Test {
 protected:
  void SetUp() override { ASSERT_NE(loop, nullptr); }
  // Runs the loop until `done` is true; a test that waits for nothing fails instead of hanging.
  void runUntil(const std::function<bool()>& done) {
    while (!done()) ASSERT_NE(loop->run(20s, ReturnAfterSource::yes), RunResult::timedOut);
  }
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
};

TEST_F(SystemQueuesTest, ReturnsAfterASourceWasHandled) {
  std::array<int, 2> pipe{};
  ASSERT_EQ(::pipe2(pipe.data(), O_CLOEXEC), 0);
  const UniqueFd read(pipe[0]);
  const UniqueFd write(pipe[1]);
  int handled = 0;
  const auto source = loop->addDescriptor(read.get(), Interest::reading, [&](Readiness readiness) {
    EXPECT_TRUE(readiness.isReadable);
    char byte = 0;
    EXPECT_EQ(::read(read.get(), &byte, 1), 1);
    ++handled;
  });
  EXPECT_EQ(loop->run(0s, ReturnAfterSource::yes), RunResult::timedOut);
  ASSERT_EQ(::write(write.get(), "x", 1), 1);
  EXPECT_EQ(loop->run(kNoTimeOut, ReturnAfterSource::yes), RunResult::handledSource);
  EXPECT_EQ(handled, 1);
}

TEST_F(SystemQueuesTest, WhatTheLoopPostsToItselfAndDescriptorsTakeTurns) {
  const UniqueFd ready(::eventfd(1, EFD_CLOEXEC));  // never read: always ready
  ASSERT_TRUE(ready.isValid());
  int served = 0;
  const auto source = loop->addDescriptor(ready.get(), Interest::reading, [&](Readiness) { ++served; });
  SystemQueues queues(*loop);
  std::vector<int> servedBefore;
  std::function<void()> again = [&] {
    servedBefore.push_back(served);
    if (servedBefore.size() < 5) queues.main().post(again);
  };
  queues.main().post(again);
  runUntil([&] { return servedBefore.size() == 5; });
  EXPECT_EQ(servedBefore, (std::vector<int>{1, 2, 3, 4, 5}));
}

TEST_F(SystemQueuesTest, WhatTheLoopPostsToItselfRunsWithoutAnyOtherReasonToWake) {
  SystemQueues queues(*loop);
  int ran = 0;
  queues.main().post([&] { queues.main().post([&] { ++ran; }); });
  runUntil([&] { return ran == 1; });
  EXPECT_EQ(loop->run(0s, ReturnAfterSource::yes), RunResult::timedOut);
  // Another thread's task that finds the inbox in use needs no wake-up of its own either.
  queues.main().post([&] { ++ran; });
  std::thread([&] { queues.main().post([&] { ++ran; }); }).join();
  runUntil([&] { return ran == 3; });
}

TEST_F(SystemQueuesTest, StopEndsARunFromAnyThreadAndAlsoTheNextRun) {
  std::thread other([&] { loop->stop(); });
  EXPECT_EQ(loop->run(kNoTimeOut, ReturnAfterSource::no), RunResult::stopped);
  other.join();
  loop->stop();
  EXPECT_EQ(loop->run(kNoTimeOut, ReturnAfterSource::no), RunResult::stopped);
}

TEST_F(SystemQueuesTest, TimeOutEndsARunThatHasNothingToDo) {
  const auto before = std::chrono::steady_clock::now();
  EXPECT_EQ(loop->run(20ms, ReturnAfterSource::no), RunResult::timedOut);
  EXPECT_GE(std::chrono::steady_clock::now() - before, 20ms);
}

TEST_F(SystemQueuesTest, RepeatingTimerFiresUntilItsHandlerDestroysIt) {
  int fired = 0;
  std::unique_ptr<LoopSource> timer;
  timer = loop->addTimer(1ms, 1ms,
                         [&] {
                           if (++fired == 3) timer.reset();
                         },
                         {});
  runUntil([&] { return fired == 3; });
  EXPECT_EQ(loop->run(20ms, ReturnAfterSource::no), RunResult::timedOut);
  EXPECT_EQ(fired, 3);
}

TEST_F(SystemQueuesTest, ADescriptorThatIsReadyIsServedBeforeATimerThatIsDue) {
  std::array<int, 2> pipe{};
  ASSERT_EQ(::pipe2(pipe.data(), O_CLOEXEC), 0);
  const UniqueFd read(pipe[0]);
  const UniqueFd write(pipe[1]);
  std::string order;
  const auto timer = loop->addTimer(0s, 0s, [&] { order += 't'; }, {});
  std::unique_ptr<DescriptorSource> source;
  source = loop->addDescriptor(read.get(), Interest::reading, [&](Readiness) {
    order += 'd';
    source.reset();
  });
  ASSERT_EQ(::write(write.get(), "x", 1), 1);
  runUntil([&] { return order.size() == 2; });
  EXPECT_EQ(order, "dt");
}

TEST_F(SystemQueuesTest, ADescriptorIsServedBeforeATimerThatWasDueWhenItBecameReady) {
  const UniqueFd ready(::eventfd(0, EFD_CLOEXEC));
  std::string order;
  const auto timer = loop->addTimer(500ms, 0s, [&] { order += 't'; }, {});
  std::unique_ptr<DescriptorSource> source;
  source = loop->addDescriptor(ready.get(), Interest::reading, [&](Readiness) {
    order += 'd';
    source.reset();
  });
  // The clock runs down in the kernel while nobody waits for it; only then does the descriptor become ready.
  ASSERT_EQ(loop->run(0s, ReturnAfterSource::no), RunResult::timedOut);
  std::this_thread::sleep_for(550ms);
  ASSERT_EQ(::eventfd_write(ready.get(), 1), 0);
  runUntil([&] { return order.size() == 2; });
  EXPECT_EQ(order, "dt");
}

TEST_F(SystemQueuesTest, DescriptorsThatAreAlwaysReadyTakeTurns) {
  const UniqueFd first(::eventfd(1, EFD_CLOEXEC));
  const UniqueFd second(::eventfd(1, EFD_CLOEXEC));
  const UniqueFd third(::eventfd(1, EFD_CLOEXEC));
  std::array<int, 3> served{};
  const auto a = loop->addDescriptor(first.get(), Interest::reading, [&](Readiness) { ++served[0]; });
  const auto b = loop->addDescriptor(second.get(), Interest::reading, [&](Readiness) { ++served[1]; });
  const auto c = loop->addDescriptor(third.get(), Interest::reading, [&](Readiness) { ++served[2]; });
  for (int i = 0; i < 30; ++i) (void)loop->run(0s, ReturnAfterSource::yes);
  EXPECT_EQ(served, (std::array{10, 10, 10}));
}

TEST_F(SystemQueuesTest, AHandlerMayEndItsOwnWatchingAndThatOfAnotherThatIsReady) {
  const UniqueFd first(::eventfd(1, EFD_CLOEXEC));
  const UniqueFd second(::eventfd(1, EFD_CLOEXEC));
  int served = 0;
  std::unique_ptr<DescriptorSource> a;
  std::unique_ptr<DescriptorSource> b;
  const auto endBoth = [&](Readiness) {
    ++served;
    a.reset();
    b.reset();
    EXPECT_EQ(loop->run(0s, ReturnAfterSource::no), RunResult::timedOut) << "nothing is watched any more";
  };
  a = loop->addDescriptor(first.get(), Interest::reading, endBoth);
  b = loop->addDescriptor(second.get(), Interest::reading, endBoth);
  EXPECT_EQ(loop->run(0s, ReturnAfterSource::yes), RunResult::handledSource);
  EXPECT_EQ(served, 1);
}

TEST_F(SystemQueuesTest, ATimerThatIsMadeOrCancelledWhileAnotherRunsDownIsHeeded) {
  // What is cancelled and made has to be so before a timer is due, which a busy machine may be too late for:
  // such a round says nothing, and the next one takes its time.
  for (std::chrono::milliseconds unit = 1ms;; unit *= 4) {
    ASSERT_LT(unit, 2s) << "never in time";
    const UniqueFd ready(::eventfd(1, EFD_CLOEXEC));
    std::string order;
    bool isInTime = true;
    const auto start = std::chrono::steady_clock::now();
    const auto isBefore = [&](int units) { return std::chrono::steady_clock::now() - start < units * unit; };
    const auto late = loop->addTimer(40 * unit, 0s, [&] { order += 'l'; }, {});
    std::unique_ptr<LoopSource> early;
    std::unique_ptr<LoopSource> never = loop->addTimer(5 * unit, 0s, [&] { order += 'n'; }, {});
    std::unique_ptr<DescriptorSource> source;
    (void)loop->run(0s, ReturnAfterSource::no);  // both run down now
    source = loop->addDescriptor(ready.get(), Interest::reading, [&](Readiness) {
      order += 'd';
      never.reset();
      isInTime = isInTime && isBefore(5);
      early = loop->addTimer(unit, 0s,
                             [&] {
                               order += 'e';
                               isInTime = isInTime && isBefore(40);
                             },
                             {});
      source.reset();
    });
    runUntil([&] { return order.size() >= 3; });
    if (!isInTime) continue;
    EXPECT_EQ(order, "del");
    return;
  }
}

TEST_F(SystemQueuesTest, ATimerThatIsDueHasItsTurnBetweenDescriptorsThatAreAlwaysReady) {
  const UniqueFd first(::eventfd(1, EFD_CLOEXEC));
  const UniqueFd second(::eventfd(1, EFD_CLOEXEC));
  int served = 0;
  const auto a = loop->addDescriptor(first.get(), Interest::reading, [&](Readiness) { ++served; });
  const auto b = loop->addDescriptor(second.get(), Interest::reading, [&](Readiness) { ++served; });
  int ticks = 0;
  const auto timer = loop->addTimer(0s, 1ns, [&] { ++ticks; }, {});
  for (int i = 0; i < 3000; ++i) (void)loop->run(0s, ReturnAfterSource::yes);
  EXPECT_EQ(ticks + served, 3000);
  EXPECT_GT(ticks, 300);
  EXPECT_GE(served, 2 * (ticks - 1)) << "each descriptor that was ready went first";
}

TEST_F(SystemQueuesTest, TimersOfOneMomentFireInTheOrderInWhichTheyWereMadeAndOneAtATime) {
  std::vector<int> fired;
  std::vector<std::unique_ptr<LoopSource>> timers;
  constexpr int kTimers = 1000;
  for (int i = 0; i < kTimers; ++i)
    timers.push_back(loop->addTimer(0s, 0s, [&, i] { fired.push_back(i); }, {}));
  for (std::size_t before = 0; before < kTimers; before = fired.size()) {
    ASSERT_EQ(loop->run(20s, ReturnAfterSource::yes), RunResult::handledSource);
    ASSERT_EQ(fired.size(), before + 1);
  }
  EXPECT_TRUE(std::is_sorted(fired.begin(), fired.end()));
  EXPECT_EQ(loop->run(0s, ReturnAfterSource::no), RunResult::timedOut);
}

TEST_F(SystemQueuesTest, AHandlerMayCancelTimersThatAreDueAtTheSameMomentAndMakeNewOnes) {
  std::string order;
  std::vector<std::unique_ptr<LoopSource>> timers;
  timers.push_back(loop->addTimer(0s, 0s,
                                  [&] {
                                    order += '1';
                                    timers.clear();  // this one, too, while its handler runs
                                    timers.push_back(loop->addTimer(0s, 0s, [&] { order += '4'; }, {}));
                                  },
                                  {}));
  timers.push_back(loop->addTimer(0s, 0s, [&] { order += '2'; }, {}));
  timers.push_back(loop->addTimer(0s, 1ns, [&] { order += '3'; }, {}));
  runUntil([&] { return order.size() == 2; });
  EXPECT_EQ(loop->run(0s, ReturnAfterSource::no), RunResult::timedOut);
  EXPECT_EQ(order, "14");
}

TEST_F(SystemQueuesTest, TicksThatWereMissedAreDroppedAndTheRhythmStays) {
  using Clock = std::chrono::steady_clock;
  constexpr auto kInterval = 20ms;
  std::vector<Clock::time_point> ticks;
  const auto start = Clock::now();
  const auto timer = loop->addTimer(kInterval, kInterval, [&] { ticks.push_back(Clock::now()); }, {});
  std::this_thread::sleep_until(start + 5 * kInterval);
  runUntil([&] { return ticks.size() == 3; });
  EXPECT_GE(ticks[0] - start, 5 * kInterval);
  // The second may follow at once: the rhythm began a moment after `start`, which is long on a slow machine.
  EXPECT_GE(ticks[2] - start, 6 * kInterval) << "the five that were missed are one";
}

TEST_F(SystemQueuesTest, ATimerFarBeyondAnyClockIsMadeAndNeverFires) {
  const auto timer = loop->addTimer(std::chrono::nanoseconds::max(), std::chrono::nanoseconds::max(),
                                    [] { ADD_FAILURE() << "fired"; }, {});
  EXPECT_NE(timer, nullptr);
  EXPECT_EQ(loop->run(1ms, ReturnAfterSource::no), RunResult::timedOut);
}

TEST_F(SystemQueuesTest, ATimerThatIsDueFiresAlsoInARunThatMayNotWait) {
  bool fired = false;
  const auto timer = loop->addTimer(0s, 0s, [&] { fired = true; }, {});
  EXPECT_EQ(loop->run(0s, ReturnAfterSource::yes), RunResult::handledSource);
  EXPECT_TRUE(fired);
}

TEST_F(SystemQueuesTest, TimersCountTheTimeThatTheSystemSleeps) {
  const auto timer = loop->addTimer(1h, 0s, [] {}, {});
  // What the kernel says of the one clock that this process has (proc(5)).
  std::vector<std::string> clocks;
  for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fdinfo")) {
    std::ifstream file(entry.path());
    for (std::string line; std::getline(file, line);) {
      if (line.starts_with("clockid:")) clocks.push_back(line);
    }
  }
  EXPECT_EQ(clocks, std::vector<std::string>{"clockid: " + std::to_string(CLOCK_BOOTTIME)});
}

TEST_F(SystemQueuesTest, AHandlerThatRunsTheLoopMayLoseItsSourceMeanwhile) {
  const UniqueFd first(::eventfd(1, EFD_CLOEXEC));
  const UniqueFd second(::eventfd(1, EFD_CLOEXEC));
  std::string order;
  std::unique_ptr<DescriptorSource> a;
  std::unique_ptr<DescriptorSource> b;
  a = loop->addDescriptor(first.get(), Interest::reading,
                          [&, kept = std::make_shared<std::string>("a")](Readiness) {
                            b = loop->addDescriptor(second.get(), Interest::reading, [&](Readiness) {
                              order += 'b';
                              a.reset();
                              b.reset();
                            });
                            while (b != nullptr) (void)loop->run(20s, ReturnAfterSource::yes);
                            order += *kept;
                          });
  EXPECT_EQ(loop->run(20s, ReturnAfterSource::yes), RunResult::handledSource);
  EXPECT_EQ(order.back(), 'a');
}

TEST_F(SystemQueuesTest, TimerOfAnotherThreadFiresOnTheLoopAndCanBeCancelledThere) {
  std::unique_ptr<LoopSource> kept;
  std::thread::id firedOn;
  std::thread other([&] {
    kept = loop->addTimer(1ms, 0s, [&] { firedOn = std::this_thread::get_id(); }, {});
    auto cancelled = loop->addTimer(0s, 0s, [] { ADD_FAILURE() << "cancelled, and fired"; }, {});
    cancelled.reset();
  });
  other.join();
  runUntil([&] { return firedOn != std::thread::id(); });
  EXPECT_EQ(firedOn, std::this_thread::get_id());
}

TEST_F(SystemQueuesTest, LinesOfATaskCarryTheFieldsOfTheRequestThatPostedItAndOfNoOther) {
  RecordingLog log;
  SystemQueues queues(*loop);
  const auto serial = queues.makeSerial("serial", QualityOfService::standard);
  int ran = 0;
  LogCallers::shared().add(7, std::make_shared<LogCaller>(LogCaller{1, 2, "/x", "y.service"}));
  {
    const LogScope scope("Routine", 7);
    serial->post([&] {
      queues.main().post([&] {
        logUnified(LogLevel::info, "back again");
        ++ran;
      });
      queues.main().postAfter(1ms, [&] {
        logUnified(LogLevel::info, "and later");
        ++ran;
      });
    });
  }
  LogCallers::shared().remove(7);
  runUntil([&] { return ran == 2; });
  queues.main().post([&] {
    logUnified(LogLevel::info, "nobody's");
    ++ran;
  });
  runUntil([&] { return ran == 3; });
  const std::map<std::string, std::string> fields{{"BRENVIK_CALLER_PID", "1"},
                                                  {"BRENVIK_CALLER_UID", "2"},
                                                  {"BRENVIK_CALLER_EXE", "/x"},
                                                  {"BRENVIK_CALLER_UNIT", "y.service"},
                                                  {"BRENVIK_ROUTINE", "Routine"}};
  EXPECT_EQ(log.fields(), (std::vector<std::map<std::string, std::string>>{fields, fields, {}}));
}

TEST_F(SystemQueuesTest, LinesOfARepeatingTimerCarryTheFieldsOfTheRequestThatMadeIt) {
  RecordingLog log;
  SystemQueues queues(*loop);
  int ran = 0;
  std::unique_ptr<WorkQueue::Timer> timer;
  {
    const LogScope scope("Routine", 7);
    timer = queues.main().makeTimer(1ms, 1ms, 0ns, [&] {
      logUnified(LogLevel::info, "again");
      ++ran;
    });
  }
  ASSERT_TRUE(timer->activate());
  runUntil([&] { return ran >= 2; });
  const std::map<std::string, std::string> fields{{"BRENVIK_ROUTINE", "Routine"}};
  EXPECT_EQ(log.fields()[0], fields);
  EXPECT_EQ(log.fields()[1], fields);
}

TEST_F(SystemQueuesTest, MainQueueRunsTasksInOrderOnTheLoop) {
  SystemQueues queues(*loop);
  std::string order;
  queues.main().post([&] { order += 'a'; });
  std::thread other([&] { queues.main().post([&] { order += 'b'; }); });
  other.join();
  runUntil([&] { return order.size() == 2; });
  queues.main().postAfter(1ms, [&] { order += 'c'; });
  runUntil([&] { return order.size() == 3; });
  EXPECT_EQ(order, "abc");
  EXPECT_TRUE(queues.main().isCurrent());
}

TEST_F(SystemQueuesTest,
       ATaskATimerAndADescriptorThatLackMemoryAreGivenUpWithALineAndTheOthersHaveTheirTurn) {
  RecordingLog log;
  SystemQueues queues(*loop);
  const auto lackMemory = [] { throw std::bad_alloc(); };
  const UniqueFd ready(::eventfd(1, EFD_CLOEXEC));
  std::unique_ptr<DescriptorSource> source =
      loop->addDescriptor(ready.get(), Interest::reading, [&](Readiness) {
        source.reset();
        lackMemory();
      });
  bool isDone = false;
  queues.main().post(lackMemory);
  queues.main().postAfter(1ms, lackMemory);
  queues.main().postAfter(2ms, [&] { isDone = true; });
  runUntil([&] { return isDone; });
  const auto line = RecordingLog::unifiedLine(LogLevel::error, "A task was given up: out of memory");
  EXPECT_EQ(log.entries(), (std::vector{line, line, line}));
}

TEST_F(SystemQueuesTest, ASerialQueueIsNotItsMakersEvenBeforeItsThreadRuns) {
  SystemQueues queues(*loop);
  for (int i = 0; i < 20; ++i) {
    const auto queue = queues.makeSerial("new", QualityOfService::standard);
    EXPECT_FALSE(queue->isCurrent());
    std::promise<std::thread::id> ranOn;
    queue->postAfter(0s, [&] { ranOn.set_value(std::this_thread::get_id()); });  // starts the thread, too
    EXPECT_FALSE(queue->isCurrent());
    EXPECT_NE(ranOn.get_future().get(), std::this_thread::get_id());
  }
}

TEST_F(SystemQueuesTest, SerialQueueRunsItsTasksInOrderOnOneThreadOfItsOwn) {
  SystemQueues queues(*loop);
  const auto queue = queues.makeSerial("a label longer than sixteen characters", QualityOfService::standard);
  EXPECT_EQ(queue->label(), "a label longer than sixteen characters");
  std::vector<int> order;
  std::promise<std::thread::id> done;
  for (int i = 0; i < 100; ++i) queue->post([&order, i] { order.push_back(i); });
  queue->post([&] {
    EXPECT_TRUE(queue->isCurrent());
    done.set_value(std::this_thread::get_id());
  });
  EXPECT_NE(done.get_future().get(), std::this_thread::get_id());
  ASSERT_EQ(order.size(), 100U);
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST_F(SystemQueuesTest, UtilityQueueIsNicerThanTheRest) {
  SystemQueues queues(*loop);
  const auto queue = queues.makeSerial("utility", QualityOfService::utility);
  std::promise<std::pair<int, long>> done;
  queue->post([&] {
    const auto self = static_cast<id_t>(::syscall(SYS_gettid));
    done.set_value({::getpriority(PRIO_PROCESS, self), ::syscall(SYS_ioprio_get, 1, 0)});
  });
  const auto [nice, ioPriority] = done.get_future().get();
  EXPECT_EQ(nice, 10);
  EXPECT_EQ(ioPriority, (2 << 13) | 7);
}

// Runs a task on the queue and one that is delayed; whether both ran on a thread that is not this one.
bool works(WorkQueue& queue) {
  std::promise<bool> done;
  queue.post([&] {
    queue.postAfter(1ms, [&, on = std::this_thread::get_id()] {
      done.set_value(on == std::this_thread::get_id() && queue.isCurrent());
    });
  });
  return done.get_future().get() && !queue.isCurrent();
}

TEST_F(SystemQueuesTest, AStandardQueueIsStandardWhicheverThreadStartsIt) {
  const auto priorities = [] {
    const auto self = static_cast<id_t>(::syscall(SYS_gettid));
    return std::make_pair(::getpriority(PRIO_PROCESS, self), ::syscall(SYS_ioprio_get, 1, 0));
  };
  const auto usual = priorities();
  SystemQueues queues(*loop);
  const auto utility = queues.makeSerial("utility", QualityOfService::utility);
  std::promise<std::shared_ptr<WorkQueue>> made;
  std::promise<std::pair<int, long>> done;
  std::promise<std::pair<int, long>> ofGlobal;
  utility->post([&] {
    const auto standard = queues.makeSerial("standard", QualityOfService::standard);
    standard->post([&] { done.set_value(priorities()); });
    queues.global().post([&] { ofGlobal.set_value(priorities()); });
    made.set_value(standard);
  });
  const auto standard = made.get_future().get();
  EXPECT_EQ(done.get_future().get(), usual);
  EXPECT_EQ(ofGlobal.get_future().get(), usual);
  EXPECT_TRUE(works(*standard));
}

TEST_F(SystemQueuesTest, DestroyingAQueueLetsTheRunningTaskFinishAndDropsWhatIsDelayed) {
  SystemQueues queues(*loop);
  auto queue = queues.makeSerial("short", QualityOfService::standard);
  std::promise<void> started;
  std::promise<void> goOn;
  std::atomic<bool> finished = false;
  queue->post([&] {
    started.set_value();
    goOn.get_future().wait();
    finished = true;
  });
  queue->postAfter(1h, [] { ADD_FAILURE() << "dropped with the queue, and ran"; });
  started.get_future().wait();
  std::thread destroyer([&] { queue.reset(); });
  goOn.set_value();
  destroyer.join();
  EXPECT_TRUE(finished);
}

TEST_F(SystemQueuesTest, AQueueMayBeDestroyedByItsOwnTask) {
  SystemQueues queues(*loop);
  std::promise<void> posted;
  std::promise<void> destroyed;
  auto queue = queues.makeSerial("own", QualityOfService::standard);
  auto last = std::make_shared<std::shared_ptr<WorkQueue>>(queue);
  queue->post([last, &posted, &destroyed] {
    posted.get_future().wait();
    last->reset();
    destroyed.set_value();
  });
  queue.reset();
  posted.set_value();
  destroyed.get_future().wait();
}

TEST_F(SystemQueuesTest, QueueTimerRepeatsOnTheQueueUntilCancelled) {
  SystemQueues queues(*loop);
  const auto queue = queues.makeSerial("ticks", QualityOfService::standard);
  std::promise<void> three;
  int fired = 0;
  std::unique_ptr<WorkQueue::Timer> timer;
  timer = queue->makeTimer(0s, 1ms, 5us, [&] {
    EXPECT_TRUE(queue->isCurrent());
    if (++fired == 3) {
      timer->cancel();
      three.set_value();
    }
  });
  timer->activate();
  three.get_future().wait();
}

TEST_F(SystemQueuesTest, AQueueIsNotCurrentOnItsMakersThreadBeforeItsOwnHasStarted) {
  SystemQueues queues(*loop);
  const auto queue = queues.makeSerial("later", QualityOfService::standard);
  EXPECT_FALSE(queue->isCurrent());
  std::promise<std::thread::id> done;
  queue->postAfter(0s, [&] { done.set_value(std::this_thread::get_id()); });
  EXPECT_NE(done.get_future().get(), std::this_thread::get_id());
}

// Takes every descriptor that the process may have, until it is destroyed.
class NoDescriptors {
 public:
  NoDescriptors() {
    ::getrlimit(RLIMIT_NOFILE, &before_);
    const rlimit few{256, before_.rlim_max};
    ::setrlimit(RLIMIT_NOFILE, &few);
    takeAll();
  }
  ~NoDescriptors() { ::setrlimit(RLIMIT_NOFILE, &before_); }
  // Takes what has become free since; how many that were.
  std::size_t takeAll() {
    std::size_t count = 0;
    for (;; ++count) {
      UniqueFd fd(::fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 0));
      if (!fd.isValid()) return count;
      taken_.push_back(std::move(fd));
    }
  }

 private:
  rlimit before_{};
  std::vector<UniqueFd> taken_;
};

constexpr std::size_t kReservedQueues = SystemQueues::kReservedDescriptors / EventLoop::kDescriptors;

TEST_F(SystemQueuesTest, WithoutDescriptorsQueuesLiveOnTheReserveAndGetThreadsOfTheirOwn) {
  SystemQueues queues(*loop);
  NoDescriptors none;
  // Twice: a queue that goes leaves its part of the reserve to the next.
  for (int i = 0; i < 2; ++i) {
    std::vector<std::shared_ptr<WorkQueue>> made;
    while (made.size() < kReservedQueues) {
      made.push_back(queues.makeSerial("reserved", QualityOfService::standard));
      EXPECT_EQ(none.takeAll(), 0U) << "the reserve is for queues alone";
      EXPECT_TRUE(works(*made.back()));
    }
  }
}

TEST_F(SystemQueuesTest, WithoutDescriptorsAndReserveMakingAQueueFailsAndIsNoOtherThreadsBurden) {
  SystemQueues queues(*loop);
  NoDescriptors none;
  std::vector<std::shared_ptr<WorkQueue>> made;
  while (made.size() < kReservedQueues) {
    made.push_back(queues.makeSerial("reserved", QualityOfService::standard));
  }
  try {
    (void)queues.makeSerial("one too many", QualityOfService::standard);
    ADD_FAILURE() << "it was made";
  } catch (const OutOfQueues& error) {
    EXPECT_STREQ(error.what(), "no descriptor or thread is left for a work queue");
  }
  EXPECT_THROW((void)queues.global(), std::bad_alloc);
  EXPECT_TRUE(works(*made.front()));
}

TEST_F(SystemQueuesTest, WithoutADescriptorForTheClockATimerIsNotMadeAndTheNextOneIs) {
  bool fired = false;
  {
    const NoDescriptors none;
    EXPECT_EQ(loop->addTimer(0s, 0s, [] { ADD_FAILURE() << "fired"; }, {}), nullptr);
  }
  const auto timer = loop->addTimer(0s, 0s, [&] { fired = true; }, {});
  EXPECT_NE(timer, nullptr);
  runUntil([&] { return fired; });
}

TEST_F(SystemQueuesTest, WithoutADescriptorForTheClockATaskThatCannotBePutOffRunsAtOnce) {
  SystemQueues queues(*loop);
  const NoDescriptors none;
  bool ran = false;
  queues.main().postAfter(1h, [&] { ran = true; });
  EXPECT_TRUE(ran) << "too early is better than never";
}

// From now on this process can start neither thread nor process.
bool forbidThreads() {
  constexpr auto refuse = static_cast<std::uint32_t>(SECCOMP_RET_ERRNO | EAGAIN);
  std::array filter{
      sock_filter BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
      sock_filter BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_clone, 2, 0),
      sock_filter BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_clone3, 1, 0),
      sock_filter BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
      sock_filter BPF_STMT(BPF_RET | BPF_K, refuse),
  };
  const sock_fprog program{filter.size(), filter.data()};
  return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
         ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) == 0;
}

TEST_F(SystemQueuesTest, WithoutThreadsTheFirstTaskIsRefused) {
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    SystemQueues queues(*loop);
    const auto queue = queues.makeSerial("thread", QualityOfService::standard);
    if (!forbidThreads()) ::_exit(2);
    try {
      queue->post([] {});
      ::_exit(1);
    } catch (const OutOfQueues&) {
      ::_exit(0);
    }
  }
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

class ProcessExitTest : public SystemQueuesTest {
 protected:
  // A child that lives until the returned descriptor is closed.
  std::pair<pid_t, UniqueFd> child() {
    std::array<int, 2> pipe{};
    EXPECT_EQ(::pipe2(pipe.data(), O_CLOEXEC), 0);
    const pid_t pid = ::fork();
    if (pid == 0) {
      ::close(pipe[1]);
      char byte = 0;
      (void)!::read(pipe[0], &byte, 1);
      ::_exit(0);
    }
    ::close(pipe[0]);
    return {pid, UniqueFd(pipe[1])};
  }
  static std::size_t numberOfThreads() {
    const std::filesystem::directory_iterator tasks("/proc/self/task");
    return static_cast<std::size_t>(std::distance(begin(tasks), end(tasks)));
  }
};

TEST_F(ProcessExitTest, TellsOnceThatTheProcessHasExited) {
  SystemQueues queues(*loop);
  auto [pid, life] = child();
  std::promise<bool> told;
  const auto source = queues.makeProcessExitSource(pid, processStartTime(pid).value(),
                                                   [&] { told.set_value(queues.global().isCurrent()); }, {});
  ASSERT_NE(source, nullptr);
  source->activate();
  life.reset();
  // One turn begins the watching, another hears of the exit.
  ASSERT_EQ(loop->run(20s, ReturnAfterSource::yes), RunResult::handledSource);
  ASSERT_EQ(loop->run(20s, ReturnAfterSource::yes), RunResult::handledSource);
  EXPECT_TRUE(told.get_future().get());
  ::waitpid(pid, nullptr, 0);
}

TEST_F(ProcessExitTest, NoThreadIsStartedWhileThereIsNothingToTell) {
  const auto threads = [] {
    std::set<std::string> ids;
    for (const auto& task : std::filesystem::directory_iterator("/proc/self/task")) {
      ids.insert(task.path().filename());
    }
    return ids;
  };
  // A sanitizer may have one of its own, and one of an earlier test may be listed for a while after it ended.
  const auto before = threads();
  SystemQueues queues(*loop);
  auto [pid, life] = child();
  const auto source =
      queues.makeProcessExitSource(pid, processStartTime(pid).value(), [] { ADD_FAILURE() << "told"; }, {});
  ASSERT_NE(source, nullptr);
  source->activate();
  EXPECT_EQ(loop->run(0s, ReturnAfterSource::no), RunResult::timedOut);
  for (const std::string& id : threads()) EXPECT_TRUE(before.contains(id)) << "a thread was started";
  source->cancel();
  life.reset();
  ::waitpid(pid, nullptr, 0);
}

TEST_F(ProcessExitTest, MayBeMadeOnAnyThreadAndOutliveTheQueues) {
  auto queues = std::make_unique<SystemQueues>(*loop);
  auto [pid, life] = child();
  std::promise<void> told;
  std::unique_ptr<ProcessExitSource> source;
  std::thread other([&, child = pid] {
    source =
        queues->makeProcessExitSource(child, processStartTime(child).value(), [&] { told.set_value(); }, {});
    source->activate();
  });
  other.join();
  auto [latePid, lateLife] = child();
  const auto late =
      queues->makeProcessExitSource(latePid, processStartTime(latePid).value(),
                                    [] { ADD_FAILURE() << "told after the queues had gone"; }, {});
  late->activate();
  ASSERT_EQ(::kill(pid, SIGKILL), 0);  // the second child holds the first one's pipe, too
  const auto future = told.get_future();
  for (int i = 0; i < 2000 && future.wait_for(1ms) != std::future_status::ready; ++i) {
    (void)loop->run(10ms, ReturnAfterSource::no);
  }
  ASSERT_EQ(future.wait_for(0s), std::future_status::ready);
  queues.reset();
  ASSERT_EQ(::kill(latePid, SIGKILL), 0);
  EXPECT_EQ(loop->run(20s, ReturnAfterSource::yes), RunResult::handledSource);
  ::waitpid(pid, nullptr, 0);
  ::waitpid(latePid, nullptr, 0);
}

TEST_F(ProcessExitTest, TheActivationItselfLooksAtNothing) {
  SystemQueues queues(*loop);
  auto [pid, life] = child();
  std::atomic<bool> isTold{false};
  std::promise<void> told;
  const auto wrong = queues.makeProcessExitSource(pid, processStartTime(pid).value() + 1,
                                                  [&] {
                                                    isTold = true;
                                                    told.set_value();
                                                  },
                                                  {});
  const std::size_t before = numberOfThreads();
  wrong->activate();
  EXPECT_LE(numberOfThreads(), before) << "it was told to the global queue";
  EXPECT_FALSE(isTold) << "whoever activates it may have an answer to give first";
  ASSERT_EQ(loop->run(20s, ReturnAfterSource::yes), RunResult::handledSource);
  told.get_future().wait();
  life.reset();
  ::waitpid(pid, nullptr, 0);
}

TEST_F(ProcessExitTest, TellsWithTheNextTurnWhenTheProcessIsGoneOrTheIdNamesAnother) {
  SystemQueues queues(*loop);
  auto [pid, life] = child();
  const std::uint32_t startTime = processStartTime(pid).value();
  std::promise<void> another;
  const auto wrong = queues.makeProcessExitSource(pid, startTime + 1, [&] { another.set_value(); }, {});
  wrong->activate();
  ASSERT_EQ(loop->run(20s, ReturnAfterSource::yes), RunResult::handledSource);
  another.get_future().wait();
  life.reset();
  ::waitpid(pid, nullptr, 0);
  std::promise<void> gone;
  const auto source = queues.makeProcessExitSource(pid, startTime, [&] { gone.set_value(); }, {});
  ASSERT_NE(source, nullptr);
  source->activate();
  ASSERT_EQ(loop->run(20s, ReturnAfterSource::yes), RunResult::handledSource);
  gone.get_future().wait();
}

TEST_F(ProcessExitTest, CancelRunsItsHandlerOnceAndTheExitIsNotTold) {
  SystemQueues queues(*loop);
  auto [pid, life] = child();
  std::promise<void> cancelled;
  auto source = queues.makeProcessExitSource(
      pid, processStartTime(pid).value(), [] { ADD_FAILURE() << "cancelled, and told"; },
      [&] { cancelled.set_value(); });
  source->activate();
  source->cancel();
  source->cancel();
  cancelled.get_future().wait();
  life.reset();
  ::waitpid(pid, nullptr, 0);
  source.reset();
}

TEST_F(ProcessExitTest, ASourceThatOutlivesItsLoopKeepsNothingOpen) {
  const auto watched = [] {
    int count = 0;
    for (const auto& each : std::filesystem::directory_iterator("/proc/self/fd")) {
      std::error_code gone;
      if (std::filesystem::read_symlink(each.path(), gone).string().find("pidfd") != std::string::npos)
        ++count;
    }
    return count;
  };
  const int before = watched();
  auto queues = std::make_unique<SystemQueues>(*loop);
  auto [pid, life] = child();
  auto source = queues->makeProcessExitSource(pid, processStartTime(pid).value(), [] {}, {});
  ASSERT_NE(source, nullptr);
  source->activate();
  ASSERT_EQ(loop->run(0s, ReturnAfterSource::no), RunResult::timedOut);
  EXPECT_EQ(watched(), before + 1);
  queues.reset();
  loop.reset();
  source.reset();
  EXPECT_EQ(watched(), before);
  life.reset();
  ::waitpid(pid, nullptr, 0);
}

}  // namespace
}  // namespace brenvik
