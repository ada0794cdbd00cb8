// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/core/EntryPoint.h"

#include <gtest/gtest.h>

#include <new>
#include <optional>
#include <stdexcept>

#include "platform/base/fakes/FailingAllocations.h"
#include "platform/baseband/fakes/FakeBaseband.h"
#include "platform/ipc/fakes/FakePorts.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/runloop/fakes/ManualRunLoop.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

class EntryPointTest : public testing::Test {
 protected:
  // A client checks in and dies, then time passes until the server stops.
  void letTheIdleRuleEndIt() {
    loop.whenRun = [this] {
      baseband.record += "run ";
      PortName port = kNullPort;
      const PortName service = sources.routineSources.at(0)->port;
      ASSERT_EQ(BVMobileHelperCheckIn(platform, service, ports.adoptSendRight(), &port, {}), 0);
      sources.deathWatches.at(0)->tellDeath();
      loop.whenRun = [this] { clock.advance(10s); };
    };
  }

  ManualClock clock;
  ManualRunLoop loop{clock};
  FakePortSpace ports;
  FakeBootstrap bootstrap{ports};
  FakePortSources sources;
  PortServerRegistry registry;
  ServerPlatform platform{
      ports, bootstrap, sources, loop, [](const char*, const AuditToken&) { return true; }, registry};
  NoRoutines requests;
  FakeBasebandLibrary baseband;
  int worksEnded = 0;
  std::function<void()> endWork = [this] { ++worksEnded; };
  RecordingLog log;
};

TEST_F(EntryPointTest, ServesUntilTheIdleRuleEndsItAndExitsWith0) {
  baseband.hosts = false;
  letTheIdleRuleEndIt();
  EXPECT_EQ(runHelper(baseband, platform, requests, endWork), 0);
  EXPECT_EQ(bootstrap.name, "com.norvale.brenvik.mobile-helper");
  EXPECT_EQ(baseband.record, "canHost run ");
  EXPECT_EQ(worksEnded, 1);
  EXPECT_EQ(registry.size(), 0U);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(EntryPointTest, WorkOfOtherThreadsEndsWhileTheServerItHoldsATokenOfStillStands) {
  baseband.hosts = false;
  std::uint32_t token = 0;
  ServerContext* server = nullptr;
  loop.whenRun = [&] {
    server = LookupServer(registry, sources.routineSources.at(0)->port);
    ASSERT_NE(server, nullptr);
    token = AcquireBusyToken(*server);
    StopServer(*server);
  };
  endWork = [&] {
    EXPECT_EQ(LookupServer(registry, sources.routineSources.at(0)->port), server);
    EXPECT_EQ(ReleaseBusyToken(*server, token), 1U);
  };
  EXPECT_EQ(runHelper(baseband, platform, requests, endWork), 0);
  EXPECT_EQ(token, 1U);
  EXPECT_EQ(registry.size(), 0U);
  EXPECT_EQ(loop.timers(), 0U) << "the countdown that the token's return began went with the server";
}

TEST_F(EntryPointTest, AHostedServerIsStartedBeforeAndStoppedAfterTheServiceAndAskedAtEachTick) {
  baseband.busy = true;
  letTheIdleRuleEndIt();
  const auto first = loop.whenRun;
  loop.whenRun = [&, first] {
    first();
    const auto tick = loop.whenRun;
    loop.whenRun = [&, tick] {
      if (baseband.busyQuestions == 2) baseband.busy = false;
      tick();
    };
  };
  EXPECT_EQ(runHelper(baseband, platform, requests, endWork), 0);
  EXPECT_EQ(baseband.busyQuestions, 3);
  EXPECT_EQ(baseband.record, "canHost create start run stop release ");
}

TEST_F(EntryPointTest, ALibraryThatMakesNoServerHostsNone) {
  baseband.makesServer = false;
  letTheIdleRuleEndIt();
  EXPECT_EQ(runHelper(baseband, platform, requests, endWork), 0);
  EXPECT_EQ(baseband.record, "canHost create run ");
}

TEST_F(EntryPointTest, AServiceThatCannotBeSetUpIsLoggedTwiceAndExitsWith1AfterStoppingTheHostedServer) {
  bootstrap.refuseWith = kern::noAccess;
  std::size_t linesBeforeTheStop = 0;
  baseband.whenStopped = [&] { linesBeforeTheStop = log.entries().size(); };
  EXPECT_EQ(runHelper(baseband, platform, requests, endWork), 1);
  EXPECT_EQ(linesBeforeTheStop, 1U) << "the second line comes after the stop";
  EXPECT_EQ(
      log.entries(),
      (std::vector{
          RecordingLog::unifiedLine(LogLevel::error, "unable to create server objects - out of resources"),
          RecordingLog::unifiedLine(LogLevel::error, "unable to startup BrenvikMobileHelper server")}));
  EXPECT_EQ(baseband.record, "canHost create start stop release ");
  EXPECT_EQ(loop.runs, 0);
  EXPECT_EQ(worksEnded, 0);
}

TEST_F(EntryPointTest, WithoutMemoryForTheServerTheHostedServerIsStoppedAndTheStatusIs1) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "nothing fails under this sanitizer";
  std::optional<FailingAllocations> failing;
  baseband.whenStarted = [&] { failing.emplace(0, FailingAllocations::HowMany::one); };
  EXPECT_EQ(runHelper(baseband, platform, requests, endWork), 1);
  failing.reset();
  EXPECT_EQ(log.entries(), std::vector{RecordingLog::unifiedLine(
                               LogLevel::error, "unable to startup BrenvikMobileHelper server")});
  EXPECT_EQ(baseband.record, "canHost create start stop release ");
  EXPECT_EQ(loop.runs, 0);
}

TEST_F(EntryPointTest, WithoutMemoryForTheIdleCheckNothingIsServedAndTheStatusIs1) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "nothing fails under this sanitizer";
  bootstrap.name.reserve(64);
  std::optional<FailingAllocations> failing;
  // After six of the server and the fakes that it is made with.
  baseband.whenStarted = [&] { failing.emplace(6, FailingAllocations::HowMany::one); };
  EXPECT_EQ(runHelper(baseband, platform, requests, endWork), 1);
  failing.reset();
  ASSERT_EQ(sources.routineSources.size(), 1U) << "the server had been made";
  EXPECT_FALSE(sources.routineSources[0]->valid);
  EXPECT_EQ(registry.size(), 0U);
  EXPECT_EQ(baseband.record, "canHost create start stop release ");
  EXPECT_EQ(loop.runs, 0);
}

TEST_F(EntryPointTest, AnExceptionOutOfTheWorkIsToldInTheLogAndMakesTheStatus1) {
  const std::function<int()> works[] = {[]() -> int { throw std::bad_alloc(); },
                                        []() -> int { throw std::runtime_error("a reason of its own"); },
                                        []() -> int { throw 7; }};
  for (const auto& work : works) {
    EXPECT_EQ(runReportingFailure(work), 1);
    EXPECT_EQ(log.entries(), std::vector{RecordingLog::unifiedLine(
                                 LogLevel::error, "unable to startup BrenvikMobileHelper server")});
    log.clear();
  }
}

TEST_F(EntryPointTest, TheStatusOfWorkThatEndsIsItsOwnAndNothingIsLogged) {
  EXPECT_EQ(runReportingFailure([] { return 0; }), 0);
  EXPECT_EQ(runReportingFailure([] { return 1; }), 1);
  EXPECT_TRUE(log.entries().empty());
}

}  // namespace
}  // namespace brenvik
