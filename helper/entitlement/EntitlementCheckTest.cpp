// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/entitlement/EntitlementCheck.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <barrier>
#include <chrono>
#include <csignal>
#include <functional>
#include <future>
#include <map>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include "platform/base/ProcessFacts.h"
#include "platform/log/Log.h"
#include "platform/log/LogContext.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/runloop/fakes/ManualRunLoop.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/security/fakes/FakeTaskSecurity.h"

namespace brenvik {
namespace {

constexpr const char* kName = "com.norvale.Teravox.BrenvikHelper.allow";
constexpr const char* kOther = "com.norvale.other";

AuditToken tokenOf(pid_t pid, std::uint32_t version = 100) {
  AuditToken token;
  token.words = {~0U, 501, 20, 501, 20, static_cast<std::uint32_t>(pid), 1, version};
  return token;
}

class EntitlementCheckTest : public testing::Test {
 protected:
  void exits(pid_t pid) {
    queues.processExits(pid);
    queues.global().runReady();
  }
  ManualClock clock;
  ManualWorkQueues queues{clock};
  FakeTaskSecurity security;
  EntitlementCheck check{security, queues};
  const AuditToken caller = tokenOf(7);
};

TEST_F(EntitlementCheckTest, ACallerThatHoldsTheEntitlementAsTrueIsGranted) {
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
}

TEST_F(EntitlementCheckTest, ACallerThatHoldsItAsSomethingThatIsNoBooleanIsRefused) {
  for (const auto& value : {PropertyList::string("true"), PropertyList::integer(1), PropertyList::real(1),
                            PropertyList::array({PropertyList::boolean(true)})}) {
    security.grant(caller, kName, value);
    EXPECT_FALSE(check.HasEntitlement(kName, caller));
  }
}

TEST_F(EntitlementCheckTest, ACallerThatHoldsItAsFalseIsRefused) {
  security.grant(caller, kName, PropertyList::boolean(false));
  EXPECT_FALSE(check.HasEntitlement(kName, caller));
}

TEST_F(EntitlementCheckTest, ACallerWithoutItIsRefused) {
  security.addProcess(caller);
  EXPECT_FALSE(check.HasEntitlement(kName, caller));
  security.grant(caller, kOther, PropertyList::boolean(true));
  EXPECT_FALSE(check.HasEntitlement(kName, caller));
}

TEST_F(EntitlementCheckTest, ACallerThatIsGoneIsRefusedWithoutAQuestion) {
  EXPECT_FALSE(check.HasEntitlement(kName, caller));
  EXPECT_EQ(security.tasksWanted(), 1);
  EXPECT_EQ(security.questions(), 0);
}

TEST_F(EntitlementCheckTest, AnErrorRefusesWhateverValueCameWithIt) {
  security.grant(caller, kName, PropertyList::boolean(true), true);
  EXPECT_FALSE(check.HasEntitlement(kName, caller));
  security.grant(caller, kName, PropertyList(), true);
  EXPECT_FALSE(check.HasEntitlement(kName, caller));
}

TEST_F(EntitlementCheckTest, ASecondCheckInByTheSameProcessIsAnsweredWithoutAskingTheService) {
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  EXPECT_EQ(security.tasksWanted(), 1);
  EXPECT_EQ(security.questions(), 1);
  EXPECT_EQ(check.grants(), 1U);
  EXPECT_EQ(queues.watchersOf(7), 1U);
}

TEST_F(EntitlementCheckTest, AGrantStaysThoughTheServiceWouldRefuseByNow) {
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  security.grant(caller, kName, PropertyList::boolean(false));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
}

TEST_F(EntitlementCheckTest, AnotherNameOfTheSameProcessIsAskedForAndNeedsNoSecondWatcher) {
  security.grant(caller, kName, PropertyList::boolean(true));
  security.grant(caller, kOther, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  EXPECT_TRUE(check.HasEntitlement(kOther, caller));
  EXPECT_EQ(security.questions(), 2);
  EXPECT_EQ(check.grants(), 2U);
  EXPECT_EQ(check.watchers(), 1U);
  EXPECT_EQ(queues.watchersOf(7), 1U);
}

TEST_F(EntitlementCheckTest, AnotherProcessIsAskedForAndWatchedByItself) {
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  EXPECT_FALSE(check.HasEntitlement(kName, tokenOf(8)));
  security.grant(tokenOf(9), kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, tokenOf(9)));
  EXPECT_EQ(queues.watchersOf(7), 1U);
  EXPECT_EQ(queues.watchersOf(8), 0U);
  EXPECT_EQ(queues.watchersOf(9), 1U);
}

TEST_F(EntitlementCheckTest, ARefusedCallerLeavesNoCacheEntryAndNoWatcher) {
  security.grant(caller, kName, PropertyList::string("true"));
  EXPECT_FALSE(check.HasEntitlement(kName, caller));
  EXPECT_FALSE(check.HasEntitlement(kName, tokenOf(8)));
  EXPECT_EQ(check.grants(), 0U);
  EXPECT_EQ(check.watchers(), 0U);
  EXPECT_EQ(queues.watchersOf(7), 0U);
  EXPECT_EQ(queues.watchersOf(8), 0U);
}

TEST_F(EntitlementCheckTest, ARefusalIsNotRemembered) {
  security.addProcess(caller);
  EXPECT_FALSE(check.HasEntitlement(kName, caller));
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
}

TEST_F(EntitlementCheckTest, AfterTheProcessExitsItsEntriesAndItsWatcherAreGone) {
  security.grant(caller, kName, PropertyList::boolean(true));
  security.grant(caller, kOther, PropertyList::boolean(true));
  security.grant(tokenOf(9), kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  EXPECT_TRUE(check.HasEntitlement(kOther, caller));
  EXPECT_TRUE(check.HasEntitlement(kName, tokenOf(9)));
  exits(7);
  EXPECT_EQ(check.grants(), 1U) << "the other process keeps its own";
  EXPECT_EQ(check.watchers(), 1U);
  EXPECT_EQ(queues.watchersOf(7), 0U);
  EXPECT_EQ(queues.watchersOf(9), 1U);
}

TEST_F(EntitlementCheckTest, ANewProcessThatReusesTheIdIsAskedAfresh) {
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  exits(7);
  const AuditToken successor = tokenOf(7, 200);
  security.addProcess(successor);
  EXPECT_FALSE(check.HasEntitlement(kName, successor));
  EXPECT_EQ(security.questions(), 2);
}

TEST_F(EntitlementCheckTest, AProcessThatReusesTheIdIsAskedAfreshEvenBeforeTheExitWasHandled) {
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  const AuditToken successor = tokenOf(7, 200);
  security.addProcess(successor);
  EXPECT_FALSE(check.HasEntitlement(kName, successor));
  EXPECT_EQ(security.questions(), 2);
}

TEST_F(EntitlementCheckTest, ASuccessorGrantedBeforeTheExitWasHandledIsForgottenWithItAndAskedAgain) {
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  const AuditToken successor = tokenOf(7, 200);
  security.grant(successor, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, successor));
  EXPECT_TRUE(check.HasEntitlement(kName, successor));
  EXPECT_EQ(security.questions(), 2) << "its own grant is remembered meanwhile";
  EXPECT_EQ(check.watchers(), 1U);
  exits(7);
  EXPECT_EQ(check.grants(), 0U);
  EXPECT_EQ(check.watchers(), 0U);
  EXPECT_TRUE(check.HasEntitlement(kName, successor));
  EXPECT_EQ(security.questions(), 3);
  EXPECT_EQ(queues.watchersOf(7), 1U);
}

TEST_F(EntitlementCheckTest, WithoutAWatcherTheGrantIsRememberedAllTheSame) {
  queues.refuseProcessExitSources = true;
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  EXPECT_EQ(security.questions(), 1);
  EXPECT_EQ(check.grants(), 1U);
  EXPECT_EQ(check.watchers(), 0U);
  queues.refuseProcessExitSources = false;
  security.grant(caller, kOther, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kOther, caller));
  EXPECT_EQ(check.watchers(), 0U) << "the process has an entry already";
}

TEST_F(EntitlementCheckTest, AnExitThatIsToldTwiceFindsNothingToDoTheSecondTime) {
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  queues.processExits(7);
  queues.processExits(7);
  EXPECT_GE(queues.global().runReady(), 2);
  EXPECT_EQ(check.grants(), 0U);
  EXPECT_EQ(check.watchers(), 0U);
}

// Has no memory for a watcher; nothing else is used.
class ExhaustedQueues final : public WorkQueues {
 public:
  WorkQueue& main() noexcept override { std::abort(); }
  WorkQueue& global() noexcept override { std::abort(); }
  std::shared_ptr<WorkQueue> makeSerial(std::string, QualityOfService) override { std::abort(); }
  std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t, std::uint32_t, WorkQueue::Task,
                                                           WorkQueue::Task) override {
    throw std::bad_alloc();
  }
};

TEST_F(EntitlementCheckTest, WithoutMemoryToRememberItACallerIsGrantedAllTheSameAndAskedForAgain) {
  ExhaustedQueues exhausted;
  EntitlementCheck forgetful(security, exhausted);
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(forgetful.HasEntitlement(kName, caller));
  EXPECT_EQ(forgetful.grants(), 0U);
  EXPECT_TRUE(forgetful.HasEntitlement(kName, caller));
  EXPECT_EQ(security.questions(), 2);
  security.removeProcess(caller);
  EXPECT_FALSE(forgetful.HasEntitlement(kName, caller));
}

// Watchers of processes that have exited already, where nothing can be posted any more: the exit is told
// within activate(), or activate() itself finds no memory. Nothing else is used.
class ExitsAtOnce final : public WorkQueues {
 public:
  enum class Activation { tells, throws };
  explicit ExitsAtOnce(Activation activation) : activation_(activation) {}
  WorkQueue& main() noexcept override { std::abort(); }
  WorkQueue& global() noexcept override { std::abort(); }
  std::shared_ptr<WorkQueue> makeSerial(std::string, QualityOfService) override { std::abort(); }
  std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t, std::uint32_t, WorkQueue::Task onExit,
                                                           WorkQueue::Task) override {
    return std::make_unique<Source>(activation_, std::move(onExit));
  }

 private:
  class Source final : public ProcessExitSource {
   public:
    Source(Activation activation, WorkQueue::Task onExit)
        : activation_(activation), onExit_(std::move(onExit)) {}
    void activate() override {
      if (activation_ == Activation::throws) throw std::bad_alloc();
      onExit_();
    }
    void cancel() noexcept override {}

   private:
    const Activation activation_;
    const WorkQueue::Task onExit_;
  };
  const Activation activation_;
};

using EntitlementCheckDeathTest = EntitlementCheckTest;

TEST_F(EntitlementCheckDeathTest, AnExitToldWithinTheActivationForgetsTheGrantAndBlocksNobody) {
  security.grant(caller, kName, PropertyList::boolean(true));
  security.grant(caller, kOther, PropertyList::boolean(true));
  // In a process of its own, which an alarm ends if it blocks.
  EXPECT_EXIT(
      {
        ::alarm(20);
        ExitsAtOnce queuesThatFail(ExitsAtOnce::Activation::tells);
        EntitlementCheck asked(security, queuesThatFail);
        const bool first = asked.HasEntitlement(kName, caller);
        const bool forgotten = asked.grants() == 0 && asked.watchers() == 0;
        const bool second = asked.HasEntitlement(kOther, caller);
        ::_exit(first && forgotten && second && asked.grants() == 0 ? 7 : 1);
      },
      testing::ExitedWithCode(7), "");
}

TEST_F(EntitlementCheckTest, AProcessWhoseWatcherCannotBeActivatedIsGrantedAndAskedForAgain) {
  ExitsAtOnce queuesThatFail(ExitsAtOnce::Activation::throws);
  EntitlementCheck forgetful(security, queuesThatFail);
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(forgetful.HasEntitlement(kName, caller));
  EXPECT_EQ(forgetful.grants(), 0U);
  EXPECT_EQ(forgetful.watchers(), 0U);
  EXPECT_TRUE(forgetful.HasEntitlement(kName, caller));
  EXPECT_EQ(security.questions(), 2);
}

TEST_F(EntitlementCheckTest, ATokenThatNamesNoProcessIsCheckedUnderMinusOne) {
  const AuditToken nobody = tokenOf(0);
  ASSERT_EQ(nobody.pid(), -1);
  EXPECT_FALSE(check.HasEntitlement(kName, nobody));
  security.grant(nobody, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, nobody));
  EXPECT_EQ(queues.watchersOf(-1), 1U);
}

TEST_F(EntitlementCheckTest, TheLockIsNotHeldWhileTheServiceIsAskedAndTheDuplicateOfTwoMissesIsHarmless) {
  security.grant(caller, kName, PropertyList::boolean(true));
  std::barrier bothAreAsking(2);  // with the lock held, the second could not ask before the first is done
  security.whileAsked = [&] { bothAreAsking.arrive_and_wait(); };
  std::array<bool, 2> granted{};
  {
    std::jthread first([&] { granted[0] = check.HasEntitlement(kName, caller); });
    std::jthread second([&] { granted[1] = check.HasEntitlement(kName, caller); });
  }
  EXPECT_TRUE(granted[0]);
  EXPECT_TRUE(granted[1]);
  EXPECT_EQ(check.grants(), 2U);
  EXPECT_EQ(check.watchers(), 1U);
  EXPECT_EQ(queues.watchersOf(7), 1U);
  exits(7);
  EXPECT_EQ(check.grants(), 0U);
  EXPECT_EQ(check.watchers(), 0U);
}

TEST_F(EntitlementCheckTest, TheTeardownEndsEveryWatcherAndForgetsEveryGrant) {
  security.grant(caller, kName, PropertyList::boolean(true));
  security.grant(tokenOf(9), kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  EXPECT_TRUE(check.HasEntitlement(kName, tokenOf(9)));
  check.tearDown();
  EXPECT_EQ(check.grants(), 0U);
  EXPECT_EQ(check.watchers(), 0U);
  EXPECT_EQ(queues.watchersOf(7), 0U);
  EXPECT_EQ(queues.watchersOf(9), 0U);
  check.tearDown();

  EXPECT_TRUE(check.HasEntitlement(kName, caller)) << "still answered";
  EXPECT_EQ(security.questions(), 3);
  EXPECT_EQ(check.grants(), 0U) << "but no longer remembered";
  EXPECT_EQ(queues.watchersOf(7), 0U);
}

// A watcher whose activation comes late. Nothing else is used.
class LateActivation final : public WorkQueues {
 public:
  WorkQueue& main() noexcept override { std::abort(); }
  WorkQueue& global() noexcept override { std::abort(); }
  std::shared_ptr<WorkQueue> makeSerial(std::string, QualityOfService) override { std::abort(); }
  std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t pid, std::uint32_t startTime,
                                                           WorkQueue::Task whenItExits,
                                                           WorkQueue::Task) override {
    watched.emplace_back(pid, startTime);
    onExit = std::move(whenItExits);
    return std::make_unique<Source>(*this);
  }

  std::vector<std::pair<pid_t, std::uint32_t>> watched;  // with the start time
  WorkQueue::Task onExit;                                // of the latest
  std::function<void()> beforeActivation;
  int activations = 0;
  int activationsInVain = 0;  // of a watcher that was cancelled before

 private:
  class Source final : public ProcessExitSource {
   public:
    explicit Source(LateActivation& owner) : owner_(owner) {}
    void activate() override {
      if (owner_.beforeActivation) owner_.beforeActivation();
      ++owner_.activations;
      if (isCancelled_) ++owner_.activationsInVain;
    }
    void cancel() noexcept override { isCancelled_ = true; }

   private:
    LateActivation& owner_;
    bool isCancelled_ = false;
  };
};

TEST_F(EntitlementCheckTest, AWatcherThatIsActivatedAfterTheTeardownWasCancelledByIt) {
  LateActivation late;
  EntitlementCheck asked(security, late);
  security.grant(caller, kName, PropertyList::boolean(true));
  late.beforeActivation = [&] { asked.tearDown(); };
  EXPECT_TRUE(asked.HasEntitlement(kName, caller));
  EXPECT_EQ(late.activations, 1);
  EXPECT_EQ(late.activationsInVain, 1);
}

TEST_F(EntitlementCheckTest, AWatcherThatIsActivatedAfterItsProcesssExitWasHandledWasCancelled) {
  LateActivation late;
  EntitlementCheck asked(security, late);
  security.grant(caller, kName, PropertyList::boolean(true));
  late.beforeActivation = [&] { late.onExit(); };
  EXPECT_TRUE(asked.HasEntitlement(kName, caller));
  EXPECT_EQ(late.activations, 1);
  EXPECT_EQ(late.activationsInVain, 1);
  EXPECT_EQ(asked.grants(), 0U);
}

TEST_F(EntitlementCheckTest, TheProcessThatIsWatchedIsTheOneThatStartedWhenTheCallerDid) {
  LateActivation late;
  EntitlementCheck asked(security, late);
  const AuditToken later = tokenOf(7, 200);
  security.grant(later, kName, PropertyList::boolean(true));
  EXPECT_TRUE(asked.HasEntitlement(kName, later));
  EXPECT_EQ(late.watched, (std::vector<std::pair<pid_t, std::uint32_t>>{{7, 200}}));
  EXPECT_EQ(late.activations, 1);
  EXPECT_EQ(late.activationsInVain, 0);
}

TEST_F(EntitlementCheckTest, AnExitHandledAfterTheTeardownFindsNothingToDo) {
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  queues.processExits(7);
  check.tearDown();
  EXPECT_GE(queues.global().runReady(), 1);
  EXPECT_EQ(check.watchers(), 0U);
}

TEST_F(EntitlementCheckTest, AnExitHandledAfterTheCheckIsGoneFindsNothingToDo) {
  security.grant(caller, kName, PropertyList::boolean(true));
  {
    EntitlementCheck shortLived(security, queues);
    EXPECT_TRUE(shortLived.HasEntitlement(kName, caller));
    queues.processExits(7);
  }
  EXPECT_EQ(queues.watchersOf(7), 0U);
  EXPECT_GE(queues.global().runReady(), 1);
}

TEST_F(EntitlementCheckTest, ARefusalIsToldWithTheCallerTheEntitlementAndTheReason) {
  RecordingLog log;
  const LogScope request("Routine", 3);
  security.addProcess(caller);
  security.refusal = "no file names it, says the fake";
  EXPECT_FALSE(check.HasEntitlement(kName, caller));
  EXPECT_EQ(log.entries(),
            (std::vector{RecordingLog::unifiedLine(
                LogLevel::standard,
                "refused process 7: account 501, executable /usr/libexec/program, unit program.service: it "
                "does not "
                "hold com.norvale.Teravox.BrenvikHelper.allow: no file names it, says the fake")}));
  EXPECT_EQ(log.fields(),
            (std::vector<std::map<std::string, std::string>>{{{"BRENVIK_CALLER_PID", "7"},
                                                              {"BRENVIK_CALLER_UID", "501"},
                                                              {"BRENVIK_CALLER_EXE", "/usr/libexec/program"},
                                                              {"BRENVIK_CALLER_UNIT", "program.service"},
                                                              {"BRENVIK_ROUTINE", "Routine"}}}));
  log.clear();
  EXPECT_FALSE(check.HasEntitlement(kName, tokenOf(8)));
  EXPECT_EQ(log.entries(),
            (std::vector{RecordingLog::unifiedLine(
                LogLevel::standard,
                "refused process 8: account 501, executable not known, unit none: it does not hold "
                "com.norvale.Teravox.BrenvikHelper.allow: the caller has ended")}));
}

TEST_F(EntitlementCheckTest, RefusalsThatHadNoLineAreToldAtTheTeardown) {
  RecordingLog log;
  security.addProcess(caller);
  for (int i = 0; i < 3; ++i) EXPECT_FALSE(check.HasEntitlement(kName, caller));
  EXPECT_EQ(security.explanations(), 1);
  check.tearDown();
  ASSERT_EQ(log.entries().size(), 2U);
  EXPECT_EQ(log.entries()[1].line,
            "refused 2 more check-ins of account 501, executable /usr/libexec/program");
}

TEST_F(EntitlementCheckTest, RefusalsThatHadNoLineAreToldWhenTheCheckEnds) {
  RecordingLog log;
  security.addProcess(caller);
  {
    EntitlementCheck shortLived(security, queues);
    for (int i = 0; i < 2; ++i) EXPECT_FALSE(shortLived.HasEntitlement(kName, caller));
    EXPECT_EQ(log.entries().size(), 1U);
  }
  ASSERT_EQ(log.entries().size(), 2U);
  EXPECT_EQ(log.entries()[1].line,
            "refused 1 more check-ins of account 501, executable /usr/libexec/program");
}

TEST_F(EntitlementCheckTest, TheClockOfRefusalsIsTheSystemsThatIsNeverSet) {
  const auto before = std::chrono::steady_clock::now().time_since_epoch();
  const auto told = EntitlementCheck::steadyTime();
  EXPECT_GE(told, before);
  EXPECT_LE(told, std::chrono::steady_clock::now().time_since_epoch());
}

TEST_F(EntitlementCheckTest, AGrantedCallerIsDescribedUntilItsProcessExitsAndNobodyElseIs) {
  RecordingLog log;
  EXPECT_EQ(check.describe(caller), nullptr);
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  const auto described = check.describe(caller);
  ASSERT_NE(described, nullptr);
  EXPECT_EQ(described->pid, 7);
  EXPECT_EQ(described->uid, 501U);
  EXPECT_EQ(described->executable, "/usr/libexec/program");
  EXPECT_EQ(described->unit, "program.service");
  EXPECT_EQ(check.describe(tokenOf(7, 200)), nullptr) << "another process by now";
  exits(7);
  EXPECT_EQ(check.describe(caller), nullptr);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(EntitlementCheckTest, WithoutMemoryToDescribeACallerTheAnswerIsTheSame) {
  RecordingLog log;
  security.hasNoMemoryToDescribe = true;
  security.addProcess(tokenOf(8));
  EXPECT_FALSE(check.HasEntitlement(kName, tokenOf(8)));
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  EXPECT_EQ(check.describe(caller), nullptr);
  EXPECT_TRUE(log.entries().empty());
  check.tearDown();
  EXPECT_EQ(check.describe(caller), nullptr);
}

TEST_F(EntitlementCheckTest, TwoChecksKnowNothingOfEachOther) {
  EntitlementCheck another(security, queues);
  security.grant(caller, kName, PropertyList::boolean(true));
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  EXPECT_EQ(another.grants(), 0U);
  EXPECT_TRUE(another.HasEntitlement(kName, caller));
  EXPECT_EQ(security.questions(), 2);
}

// Process-exit sources whose handlers run on whatever thread reports the exit; nothing else is used.
class ThreadedExits final : public WorkQueues {
 public:
  WorkQueue& main() noexcept override { std::abort(); }
  WorkQueue& global() noexcept override { std::abort(); }
  std::shared_ptr<WorkQueue> makeSerial(std::string, QualityOfService) override { std::abort(); }
  std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t pid, std::uint32_t, WorkQueue::Task onExit,
                                                           WorkQueue::Task) override {
    auto source = std::make_unique<Source>(*this);
    const std::lock_guard lock(mutex_);
    watched_.emplace(source.get(), std::make_pair(pid, std::move(onExit)));
    return source;
  }
  void processExits(pid_t pid) {
    std::vector<WorkQueue::Task> handlers;
    {
      const std::lock_guard lock(mutex_);
      for (const auto& [source, watch] : watched_) {
        if (watch.first == pid) handlers.push_back(watch.second);
      }
    }
    for (const auto& handler : handlers) handler();
  }
  std::size_t watched() {
    const std::lock_guard lock(mutex_);
    return watched_.size();
  }

 private:
  class Source final : public ProcessExitSource {
   public:
    explicit Source(ThreadedExits& owner) : owner_(owner) {}
    ~Source() override { cancel(); }
    void activate() override {}
    void cancel() noexcept override {
      const std::lock_guard lock(owner_.mutex_);
      owner_.watched_.erase(this);
    }

   private:
    ThreadedExits& owner_;
  };
  std::mutex mutex_;
  std::map<Source*, std::pair<pid_t, WorkQueue::Task>> watched_;
};

TEST(EntitlementCheckConcurrencyTest, ChecksExitsAndTheTeardownMayMeetInAnyOrder) {
  constexpr int kThreads = 4;
  constexpr int kRounds = 2000;
  constexpr pid_t kProcesses = 8;
  ThreadedExits queues;
  FakeTaskSecurity security;
  EntitlementCheck check(security, queues);
  for (pid_t pid = 1; pid <= kProcesses; ++pid) {
    security.grant(tokenOf(pid, 1), kName, PropertyList::boolean(true));
    security.grant(tokenOf(pid, 2), kName, PropertyList::boolean(false));
  }
  std::atomic<int> wrong{0};
  std::atomic<bool> done{false};
  std::jthread exits([&] {
    for (pid_t pid = 1; !done; pid = pid % kProcesses + 1) queues.processExits(pid);
  });
  {
    std::vector<std::jthread> callers;
    for (int thread = 0; thread < kThreads; ++thread) {
      callers.emplace_back([&check, &wrong, thread] {
        for (int round = 0; round < kRounds; ++round) {
          const pid_t pid = (round * (thread + 1)) % kProcesses + 1;
          if (!check.HasEntitlement(kName, tokenOf(pid, 1))) ++wrong;
          if (check.HasEntitlement(kName, tokenOf(pid, 2))) ++wrong;
        }
      });
    }
  }
  done = true;
  exits.join();
  EXPECT_EQ(wrong, 0);
  for (pid_t pid = 1; pid <= kProcesses; ++pid) queues.processExits(pid);
  EXPECT_EQ(check.grants(), 0U);
  EXPECT_EQ(check.watchers(), 0U);
  EXPECT_EQ(queues.watched(), 0U);

  std::jthread last([&] { queues.processExits(1); });
  EXPECT_TRUE(check.HasEntitlement(kName, tokenOf(1, 1)));
  check.tearDown();
  last.join();
  EXPECT_EQ(queues.watched(), 0U);
}

// The system's queues, which tell when an exit has been handled.
class ObservedQueues final : public WorkQueues {
 public:
  explicit ObservedQueues(WorkQueues& real) : real_(real) {}
  WorkQueue& main() noexcept override { return real_.main(); }
  WorkQueue& global() override { return real_.global(); }
  std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService qualityOfService) override {
    return real_.makeSerial(std::move(label), qualityOfService);
  }
  std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t pid, std::uint32_t startTime,
                                                           WorkQueue::Task onExit,
                                                           WorkQueue::Task onCancel) override {
    return real_.makeProcessExitSource(
        pid, startTime,
        [this, onExit = std::move(onExit)] {
          const auto tell = handled;  // the handler destroys the source, and this task with it
          onExit();
          tell->set_value();
        },
        std::move(onCancel));
  }
  const std::shared_ptr<std::promise<void>> handled = std::make_shared<std::promise<void>>();

 private:
  WorkQueues& real_;
};

class RealProcessTest : public testing::Test {
 protected:
  void SetUp() override {
    child = ::fork();
    if (child == 0) {
      ::pause();
      ::_exit(0);
    }
    ASSERT_GT(child, 0);
    caller = tokenOf(child, processStartTime(child).value());
    security.grant(caller, kName, PropertyList::boolean(true));
  }
  void TearDown() override { endChild(); }
  // The main loop notices an exit, the global queue handles it.
  bool exitIsHandled() {
    const auto future = queues.handled->get_future();
    for (int i = 0; i < 30; ++i) {
      (void)loop->run(std::chrono::milliseconds(100), ReturnAfterSource::no);
      if (future.wait_for(std::chrono::milliseconds(900)) == std::future_status::ready) return true;
    }
    return false;
  }
  void endChild() {
    if (child <= 0) return;
    ::kill(child, SIGKILL);
    ::waitpid(child, nullptr, 0);
    child = -1;
  }
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemQueues system{*loop};
  ObservedQueues queues{system};
  FakeTaskSecurity security;
  EntitlementCheck check{security, queues};
  pid_t child = -1;
  AuditToken caller;
};

TEST_F(RealProcessTest, AGrantIsForgottenWhenItsProcessExits) {
  EXPECT_TRUE(check.HasEntitlement(kName, caller));
  EXPECT_EQ(check.grants(), 1U);
  EXPECT_EQ(check.watchers(), 1U);
  endChild();
  ASSERT_TRUE(exitIsHandled());
  EXPECT_EQ(check.grants(), 0U);
  EXPECT_EQ(check.watchers(), 0U);
}

TEST_F(RealProcessTest, AProcessThatExitsWhileItIsBeingGrantedIsForgottenAtOnce) {
  security.whileAsked = [this] { endChild(); };
  EXPECT_TRUE(check.HasEntitlement(kName, caller)) << "it was there when the service answered";
  ASSERT_TRUE(exitIsHandled());
  EXPECT_EQ(check.grants(), 0U);
  EXPECT_EQ(check.watchers(), 0U);
}

}  // namespace
}  // namespace brenvik
