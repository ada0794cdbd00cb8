// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "Helper/Shared/Server/HelperServerUtils.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <csignal>
#include <cstring>
#include <limits>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/base/fakes/FailingAllocations.h"
#include "platform/ipc/fakes/FakePorts.h"
#include "platform/log/Log.h"
#include "platform/log/LogContext.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/runloop/fakes/ManualRunLoop.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

class ServerTest : public testing::Test {
 protected:
  void create() {
    server = CreateServer(platform, kServiceName, routines);
    ASSERT_NE(server, nullptr);
  }

  KernelReturn checkIn() {
    clientPort = 0x7777;  // what is not the server's must not stay
    callerPort = ports.adoptSendRight();
    return BVMobileHelperCheckIn(platform, server->servicePort(), callerPort, &clientPort, AuditToken{});
  }
  void countDown() {
    ReleaseBusyToken(*server, AcquireBusyToken(*server));
    ASSERT_TRUE(idleTimerRuns());
  }
  // The client whose check-in was the n-th dies.
  void clientDies(std::size_t n) { sources.deathWatches.at(n)->tellDeath(); }
  bool idleTimerRuns() const { return loop.timers() == 1; }

  ManualClock clock;
  ManualRunLoop loop{clock};
  FakePortSpace ports;
  FakeBootstrap bootstrap{ports};
  FakePortSources sources;
  PortServerRegistry registry;
  bool entitled = true;
  std::string askedEntitlement;
  AuditToken askedCaller{};
  ServerPlatform platform{ports,
                          bootstrap,
                          sources,
                          loop,
                          [this](const char* name, const AuditToken& caller) {
                            askedEntitlement = name;
                            askedCaller = caller;
                            return entitled;
                          },
                          registry};
  NoRoutines routines;
  std::unique_ptr<ServerContext> server;
  PortName callerPort = kNullPort;
  PortName clientPort = kNullPort;
  RecordingLog log;
};

// ---- creation and destruction ----

TEST_F(ServerTest, CreationChecksTheServiceNameInAndServesCheckInsOnItsPort) {
  create();
  EXPECT_EQ(bootstrap.name, "com.norvale.brenvik.mobile-helper");
  EXPECT_EQ(registry.lookUp(server->servicePort()), server.get());
  ASSERT_EQ(sources.routineSources.size(), 1U);
  const auto& source = *sources.routineSources[0];
  EXPECT_EQ(source.port, server->servicePort());
  EXPECT_TRUE(source.added);
  EXPECT_EQ(source.wantTrailer, WantTrailer::yes);
  EXPECT_NE(source.table.find(4792174), nullptr);
  EXPECT_EQ(source.table.find(4792173), nullptr);
  EXPECT_EQ(source.table.find(8683549), nullptr);
  EXPECT_FALSE(idleTimerRuns());
}

TEST_F(ServerTest, ARefusedServiceNameIsLoggedAndLeavesNothing) {
  bootstrap.refuseWith = kern::noAccess;
  EXPECT_EQ(CreateServer(platform, kServiceName, routines), nullptr);
  EXPECT_EQ(log.entries(), std::vector{RecordingLog::unifiedLine(
                               LogLevel::error, "unable to create server objects - out of resources")});
  EXPECT_EQ(registry.size(), 0U);
}

TEST_F(ServerTest, AMissingServiceSourceDropsThePortTwiceAndTheSecondTimeToNoEffect) {
  sources.refuseRoutineSources = true;
  EXPECT_EQ(CreateServer(platform, kServiceName, routines), nullptr);
  EXPECT_EQ(log.entries(), std::vector{RecordingLog::unifiedLine(
                               LogLevel::error, "unable to create server objects - out of resources")});
  EXPECT_TRUE(ports.receiveRights.empty());
  EXPECT_EQ(ports.failedDrops, 1);
  EXPECT_EQ(registry.size(), 0U);
}

TEST_F(ServerTest, AServiceSourceThatTheLoopRefusesFailsTheCreation) {
  sources.refuseToBeAdded = true;
  EXPECT_EQ(CreateServer(platform, kServiceName, routines), nullptr);
  EXPECT_TRUE(ports.receiveRights.empty());
}

TEST_F(ServerTest, WithoutMemoryForTheContextCreationReturnsNullWithoutALine) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "nothing fails under this sanitizer";
  {
    const FailingAllocations failing(0, FailingAllocations::HowMany::one);
    EXPECT_EQ(CreateServer(platform, kServiceName, routines), nullptr);
  }
  EXPECT_TRUE(log.entries().empty());
  EXPECT_EQ(bootstrap.name, "") << "the service name was not asked for";
}

TEST_F(ServerTest, WithoutMemoryToServeThePortCreationFailsAsOutOfResourcesAndLeavesNothing) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "nothing fails under this sanitizer";
  bootstrap.name.reserve(64);
  // After the context and the fake's receive right: the registry's entry, then the table of the port.
  for (const long number : {2, 3}) {
    log.clear();
    {
      const FailingAllocations failing(number, FailingAllocations::HowMany::one);
      EXPECT_EQ(CreateServer(platform, kServiceName, routines), nullptr);
    }
    EXPECT_EQ(log.entries(), std::vector{RecordingLog::unifiedLine(
                                 LogLevel::error, "unable to create server objects - out of resources")});
    EXPECT_EQ(registry.size(), 0U);
    EXPECT_TRUE(ports.receiveRights.empty());
  }
}

TEST_F(ServerTest, DestructionTearsEveryClientDownAndGivesThePortBack) {
  create();
  ASSERT_EQ(checkIn(), kern::success);
  ASSERT_EQ(checkIn(), kern::success);
  const PortName servicePort = server->servicePort();
  std::vector<std::string> order;
  const auto note = [&](std::string what) {
    return [&, what] {
      const bool isKnown = LookupServer(registry, servicePort) != nullptr;
      EXPECT_EQ(ports.receiveRights.count(servicePort) != 0, isKnown);
      order.push_back(what + (isKnown ? "" : ", without port"));
    };
  };
  sources.routineSources[0]->whenInvalidated = note("service");
  sources.routineSources[1]->whenInvalidated = note("client");
  sources.deathWatches[0]->whenInvalidated = note("watch");
  auto idleCheck = std::make_shared<int>(0);
  const std::weak_ptr<int> isHeld = idleCheck;
  SetIdleCheck(server.get(), [held = std::exchange(idleCheck, nullptr)] { return held != nullptr; });
  const auto serviceEnds = sources.routineSources[0]->whenInvalidated;
  sources.routineSources[0]->whenInvalidated = [&] {
    EXPECT_TRUE(isHeld.expired()) << "the idle check goes first";
    serviceEnds();
  };
  DestroyServer(std::move(server));
  EXPECT_EQ(order, (std::vector<std::string>{"service", "watch, without port", "client, without port"}));
  for (const auto& watch : sources.deathWatches) EXPECT_FALSE(watch->hasCallback()) << "it names the server";
  EXPECT_EQ(registry.size(), 0U);
  EXPECT_TRUE(ports.receiveRights.empty());
  EXPECT_TRUE(ports.sendRights.empty());
  EXPECT_EQ(ports.failedDrops, 0);
  for (const auto& source : sources.routineSources) EXPECT_FALSE(source->valid);
  EXPECT_FALSE(idleTimerRuns());
}

// ---- run and stop ----

TEST_F(ServerTest, RunServerOnAContextWhoseStopFlagIsSetReturns0WithoutRunningTheLoop) {
  create();
  EXPECT_EQ(StopServer(*server), 0);
  EXPECT_EQ(RunServer(*server), 0);
  EXPECT_EQ(loop.runs, 0);
}

TEST_F(ServerTest, RunServerRunsTheLoopAgainAfterEachSourceUntilStopped) {
  create();
  loop.whenRun = [&] {
    if (loop.runs == 3) StopServer(*server);
  };
  EXPECT_EQ(RunServer(*server), static_cast<std::int32_t>(RunResult::stopped));
  EXPECT_EQ(loop.runs, 3);
  EXPECT_EQ(loop.stops, 1);
}

TEST_F(ServerTest, RunServerRunsTheLoopWithoutATimeOutAndUntilASourceWasHandled) {
  class LoopOfOneRun final : public RunLoop {
   public:
    RunResult run(std::chrono::duration<double> timeOut, ReturnAfterSource after) override {
      EXPECT_EQ(timeOut.count(), std::numeric_limits<double>::max());
      EXPECT_EQ(after, ReturnAfterSource::yes);
      server->stop();
      return RunResult::stopped;
    }
    void stop() noexcept override {}
    std::unique_ptr<DescriptorSource> addDescriptor(int, Interest, DescriptorHandler) override {
      return nullptr;
    }
    std::unique_ptr<LoopSource> addTimer(std::chrono::nanoseconds, std::chrono::nanoseconds,
                                         std::function<void()>, std::function<void()>) override {
      return nullptr;
    }
    ServerContext* server = nullptr;
  } oneRun;
  const ServerPlatform its{ports, bootstrap, sources, oneRun, platform.hasEntitlement, registry};
  server = CreateServer(its, kServiceName, routines);
  ASSERT_NE(server, nullptr);
  oneRun.server = server.get();
  EXPECT_EQ(RunServer(*server), static_cast<std::int32_t>(RunResult::stopped));
  server.reset();
}

// ---- the idle rule ----

TEST_F(ServerTest, NoClientEverConnectsAndTheProcessKeepsRunningWithoutATimer) {
  create();
  clock.advance(std::chrono::hours(24 * 365));
  EXPECT_EQ(loop.stops, 0);
  EXPECT_FALSE(server->isStopped());
  EXPECT_FALSE(idleTimerRuns());
}

TEST_F(ServerTest, LastClientGoesAwayWhileTheHostedServerIsBusyAndTheProcessStaysReaskingEvery10Seconds) {
  create();
  int asked = 0;
  bool busy = true;
  SetIdleCheck(server.get(), [&] {
    ++asked;
    return busy;
  });
  ASSERT_EQ(checkIn(), kern::success);
  clientDies(0);
  clock.advance(9999ms);
  EXPECT_EQ(asked, 0);
  clock.advance(1ms);
  EXPECT_EQ(asked, 1);
  clock.advance(20s);
  EXPECT_EQ(asked, 3);
  EXPECT_FALSE(server->isStopped());
  busy = false;
  clock.advance(10s);
  EXPECT_EQ(asked, 4);
  EXPECT_TRUE(server->isStopped());
}

TEST_F(ServerTest, TheFactsSayWhatKeepsTheServer) {
  platform.now = [this] { return clock.now(); };
  create();
  SetIdleCheck(server.get(), [] { return true; });
  const auto one = AcquireBusyToken(*server, "one");
  const auto two = AcquireBusyToken(*server, "two");
  const auto three = AcquireBusyToken(*server, "one");
  auto facts = server->facts();
  ASSERT_EQ(facts.busyTokens.size(), 2U);
  EXPECT_STREQ(facts.busyTokens[0].first, "one");
  EXPECT_EQ(facts.busyTokens[0].second, 2U);
  EXPECT_STREQ(facts.busyTokens[1].first, "two");
  EXPECT_EQ(facts.busyTokens[1].second, 1U);
  EXPECT_FALSE(facts.leavesIn);
  for (const auto token : {one, two, three}) (void)ReleaseBusyToken(*server, token);
  clock.advance(3s);
  facts = server->facts();
  EXPECT_TRUE(facts.busyTokens.empty());
  EXPECT_EQ(facts.leavesIn, 7s);
  EXPECT_FALSE(facts.isKeptByIdleCheck);
  clock.advance(8s);
  facts = server->facts();
  EXPECT_EQ(facts.leavesIn, 9s);
  EXPECT_TRUE(facts.isKeptByIdleCheck);
}

TEST_F(ServerTest, ItCountsDownFromTheMomentThatNothingKeepsItUntilSomethingDoesAgain) {
  create();
  EXPECT_FALSE(server->isCountingDown()) << "no client ever connected";
  const auto token = AcquireBusyToken(*server);
  EXPECT_FALSE(server->isCountingDown());
  ReleaseBusyToken(*server, token);
  EXPECT_TRUE(server->isCountingDown());
  ASSERT_EQ(checkIn(), kern::success);
  EXPECT_FALSE(server->isCountingDown());
  clientDies(0);
  EXPECT_TRUE(server->isCountingDown());
}

TEST_F(ServerTest, TheIdleChecksAnswerIsForgottenWithTheCountdownInWhichItWasGiven) {
  platform.now = [this] { return clock.now(); };
  create();
  SetIdleCheck(server.get(), [] { return true; });
  countDown();
  clock.advance(10s);
  EXPECT_TRUE(server->facts().isKeptByIdleCheck);
  const auto token = AcquireBusyToken(*server);
  EXPECT_FALSE(server->facts().isKeptByIdleCheck) << "the token keeps it";
  ReleaseBusyToken(*server, token);
  EXPECT_EQ(server->facts().leavesIn, 10s);
  EXPECT_FALSE(server->facts().isKeptByIdleCheck) << "the check was not asked yet";
}

TEST_F(ServerTest, ATickThatIsLateLeavesTheFactsAt0UntilItComesAndThenAtThePeriodsNextEnd) {
  std::chrono::nanoseconds late{0};
  platform.now = [&] { return clock.now() + late; };
  create();
  SetIdleCheck(server.get(), [] { return true; });
  countDown();
  late = 23s;
  EXPECT_EQ(server->facts().leavesIn, 0s);
  clock.advance(10s);
  EXPECT_EQ(server->facts().leavesIn, 7s) << "the ticks of 10, 20 and 30 s have passed as one";
}

TEST_F(ServerTest, WhoeverIsToldOfAChangeMayAskForTheFacts) {
  std::vector<std::size_t> clients;
  platform.onChange = [&] { clients.push_back(server->facts().clients); };
  create();
  ASSERT_EQ(checkIn(), kern::success);
  clientDies(0);
  (void)ReleaseBusyToken(*server, AcquireBusyToken(*server));
  EXPECT_EQ(clients, (std::vector<std::size_t>{1, 0, 0, 0}));
}

TEST_F(ServerTest, MemoryIsGivenBackOnceMostOfManyClientsHaveGoneAndNotForAFew) {
  std::vector<std::size_t> left;
  platform.releaseMemory = [&] { left.push_back(server->facts().clients); };
  create();
  for (int i = 0; i < 255; ++i) ASSERT_EQ(checkIn(), kern::success);
  for (std::size_t i = 0; i < 255; ++i) clientDies(i);
  clock.advance(5s);
  EXPECT_TRUE(left.empty());
  for (int i = 0; i < 256; ++i) ASSERT_EQ(checkIn(), kern::success);
  for (std::size_t i = 0; i < 256; ++i) clientDies(255 + i);
  clock.advance(999ms);
  EXPECT_TRUE(left.empty());
  clock.advance(1ms);
  EXPECT_EQ(left, std::vector<std::size_t>{0});
  clock.advance(5s);
  EXPECT_EQ(left.size(), 1U);
}

TEST_F(ServerTest, MostOfManyClientsHaveGoneWhenAnEighthIsLeftAndAfterThatOnlyWhenAsManyHaveComeAgain) {
  std::vector<std::size_t> left;
  platform.releaseMemory = [&] { left.push_back(server->facts().clients); };
  create();
  std::size_t next = 0;
  const auto die = [&](int many) {
    for (int i = 0; i < many; ++i) clientDies(next++);
  };
  for (int i = 0; i < 256; ++i) ASSERT_EQ(checkIn(), kern::success);
  die(223);
  clock.advance(5s);
  EXPECT_TRUE(left.empty()) << "33 are left";
  die(1);
  clock.advance(1s);
  EXPECT_EQ(left, std::vector<std::size_t>{32});
  die(32);
  clock.advance(5s);
  EXPECT_EQ(left.size(), 1U) << "a few more have gone";
  for (int i = 0; i < 256; ++i) ASSERT_EQ(checkIn(), kern::success);
  die(256);
  clock.advance(5s);
  EXPECT_EQ(left, (std::vector<std::size_t>{32, 0}));
}

TEST_F(ServerTest, ClientsThatComeAndGoBeforeTheMemoryIsGivenBackDoNotPutThatOff) {
  std::vector<std::chrono::nanoseconds> released;
  platform.releaseMemory = [&] { released.push_back(clock.now()); };
  create();
  for (std::size_t round = 0; round < 2; ++round) {
    for (int i = 0; i < 256; ++i) ASSERT_EQ(checkIn(), kern::success);
    for (std::size_t i = 0; i < 256; ++i) clientDies(round * 256 + i);
    clock.advance(500ms);
  }
  clock.advance(5s);
  EXPECT_EQ(released, std::vector<std::chrono::nanoseconds>{1s});
}

TEST_F(ServerTest, WithoutAHostedServerTheProcessStopsAtTheFirstTick10SecondsAfterTheLastClient) {
  create();
  ASSERT_EQ(checkIn(), kern::success);
  clock.advance(60s);
  clientDies(0);
  clock.advance(9999ms);
  EXPECT_FALSE(server->isStopped());
  clock.advance(1ms);
  EXPECT_TRUE(server->isStopped());
}

TEST_F(ServerTest, WithoutAHostedServerTheProcessStopsAtTheFirstTick10SecondsAfterTheLastToken) {
  create();
  const auto token = AcquireBusyToken(*server);
  clock.advance(60s);
  EXPECT_EQ(ReleaseBusyToken(*server, token), 1U);
  clock.advance(9999ms);
  EXPECT_FALSE(server->isStopped());
  clock.advance(1ms);
  EXPECT_TRUE(server->isStopped());
}

TEST_F(ServerTest, ACheckInDuringTheIdlePeriodCancelsTheTimerAndTheCountdownRestartsFrom10Seconds) {
  create();
  ASSERT_EQ(checkIn(), kern::success);
  clientDies(0);
  clock.advance(9s);
  ASSERT_EQ(checkIn(), kern::success);
  EXPECT_FALSE(idleTimerRuns());
  clock.advance(60s);
  clientDies(1);
  clock.advance(9999ms);
  EXPECT_FALSE(server->isStopped());
  clock.advance(1ms);
  EXPECT_TRUE(server->isStopped());
}

TEST_F(ServerTest, ANewBusyTokenDuringTheIdlePeriodCancelsTheTimerAndTheCountdownRestartsFrom10Seconds) {
  create();
  ASSERT_EQ(checkIn(), kern::success);
  clientDies(0);
  clock.advance(9s);
  const auto token = AcquireBusyToken(*server);
  EXPECT_FALSE(idleTimerRuns());
  clock.advance(60s);
  ReleaseBusyToken(*server, token);
  clock.advance(9999ms);
  EXPECT_FALSE(server->isStopped());
  clock.advance(1ms);
  EXPECT_TRUE(server->isStopped());
}

TEST_F(ServerTest, AnIdleTimerThatCannotBeMadeStopsTheServerAtOnce) {
  create();
  ASSERT_EQ(checkIn(), kern::success);
  loop.refuseTimers = true;
  clientDies(0);
  EXPECT_TRUE(server->isStopped());
}

TEST_F(ServerTest, AnIdleTimerThatCannotBeArmedInTheEndStopsTheServerToo) {
  create();
  const auto token = AcquireBusyToken(*server);
  loop.failTimersLater = true;
  ReleaseBusyToken(*server, token);
  EXPECT_FALSE(server->isStopped());
  clock.advance(0ms);
  EXPECT_TRUE(server->isStopped());
}

TEST_F(ServerTest, ATickThatWasOnItsWayWhenATokenWasTakenStopsNothing) {
  create();
  ReleaseBusyToken(*server, AcquireBusyToken(*server));
  const auto tick = loop.lastTimersHandler;
  AcquireBusyToken(*server);
  tick();
  EXPECT_FALSE(server->isStopped());
}

TEST_F(ServerTest, ArmingTwiceKeepsTheFirstCountdown) {
  create();
  const auto token = AcquireBusyToken(*server);
  ReleaseBusyToken(*server, token);
  clock.advance(5s);
  ReleaseBusyToken(*server, 0x4);  // well formed, though nobody holds it
  EXPECT_TRUE(idleTimerRuns());
  clock.advance(5s);
  EXPECT_TRUE(server->isStopped());
}

TEST_F(ServerTest, SetIdleCheckWithoutServerOrBlockDoesNothing) {
  create();
  SetIdleCheck(nullptr, [] { return true; });
  SetIdleCheck(server.get(), [] { return true; });
  SetIdleCheck(server.get(), {});
  const auto token = AcquireBusyToken(*server);
  ReleaseBusyToken(*server, token);
  clock.advance(60s);
  EXPECT_FALSE(server->isStopped()) << "the check that answers true is still in place";
}

// ---- busy tokens ----

TEST_F(ServerTest, ReleaseBusyTokenWith0OrWith0x3Returns0AndLeavesTheMask) {
  create();
  AcquireBusyToken(*server);
  AcquireBusyToken(*server);
  EXPECT_EQ(ReleaseBusyToken(*server, 0), 0U);
  EXPECT_EQ(ReleaseBusyToken(*server, 0x3), 0U);
  EXPECT_EQ(server->busyMask(), 0x3U);
  EXPECT_FALSE(idleTimerRuns());
}

TEST_F(ServerTest, TokensAreTakenAboveTheRunOfHeldBitsFromBit0) {
  create();
  EXPECT_EQ(AcquireBusyToken(*server), 1U);
  EXPECT_EQ(AcquireBusyToken(*server), 2U);
  EXPECT_EQ(AcquireBusyToken(*server), 4U);
  ReleaseBusyToken(*server, 2);
  EXPECT_EQ(AcquireBusyToken(*server), 2U);
  ReleaseBusyToken(*server, 1);
  EXPECT_EQ(server->busyMask(), 0x6U);
  EXPECT_EQ(AcquireBusyToken(*server), 1U) << "a clear bit 0 below held bits is taken";
}

TEST_F(ServerTest, WithAll32TokensHeldTheNextOneIs1Again) {
  create();
  for (int i = 0; i < 32; ++i) AcquireBusyToken(*server);
  EXPECT_EQ(server->busyMask(), 0xFFFFFFFFU);
  EXPECT_EQ(AcquireBusyToken(*server), 1U);
}

TEST_F(ServerTest, EachOf32TokensHasItsReasonAndTheNextOneReplacesThatOfTheFirst) {
  create();
  AcquireBusyToken(*server, "first");
  for (int i = 1; i < 31; ++i) AcquireBusyToken(*server, "between");
  AcquireBusyToken(*server, "last");
  using Tokens = std::vector<std::pair<std::string, std::size_t>>;
  const auto expectTokens = [&](const Tokens& expected) {
    const auto held = server->facts().busyTokens;
    EXPECT_EQ(Tokens(held.begin(), held.end()), expected);
  };
  expectTokens({{"first", 1}, {"between", 30}, {"last", 1}});
  AcquireBusyToken(*server, "one more");
  expectTokens({{"one more", 1}, {"between", 30}, {"last", 1}});
}

TEST_F(ServerTest, ReleasingATokenWhileOthersAreHeldDoesNotStartTheCountdown) {
  create();
  const auto first = AcquireBusyToken(*server);
  const auto second = AcquireBusyToken(*server);
  ReleaseBusyToken(*server, first);
  EXPECT_FALSE(idleTimerRuns());
  ReleaseBusyToken(*server, second);
  EXPECT_TRUE(idleTimerRuns());
}

// ---- check-in ----

TEST_F(ServerTest, AnEntitledCallerGetsAPortOfItsOwn) {
  create();
  EXPECT_EQ(checkIn(), kern::success);
  EXPECT_EQ(askedEntitlement, "com.norvale.Teravox.BrenvikHelper.allow");
  ASSERT_EQ(sources.routineSources.size(), 2U);
  const auto& source = *sources.routineSources[1];
  EXPECT_EQ(source.port, clientPort);
  EXPECT_EQ(&source.table, &routines);
  EXPECT_EQ(source.wantTrailer, WantTrailer::no);
  EXPECT_TRUE(source.added);
  EXPECT_EQ(ports.receiveRights.at(clientPort), 1);
  EXPECT_EQ(ports.sendRights.at(clientPort), 1);
  EXPECT_EQ(LookupServer(registry, clientPort), server.get());
  EXPECT_EQ(LookupServer(registry, callerPort), server.get());
}

TEST_F(ServerTest, ThePortOfAClientIsKnownToTheLogForAsLongAsTheClientIsThere) {
  const auto described = std::make_shared<const LogCaller>();
  platform.describeCaller = [&](const AuditToken&) { return described; };
  create();
  ASSERT_EQ(checkIn(), kern::success);
  EXPECT_EQ(LogCallers::shared().find(clientPort), described);
  clientDies(0);
  EXPECT_EQ(LogCallers::shared().find(clientPort), nullptr);
  EXPECT_EQ(described.use_count(), 1) << "the client leaves nothing behind";
}

TEST_F(ServerTest, LinesOfACheckInCarryItsRoutine) {
  create();
  platform.hasEntitlement = [](const char*, const AuditToken&) {
    logUnified(LogLevel::info, "line");
    return false;
  };
  EXPECT_EQ(checkIn(), 35);
  EXPECT_EQ(log.fields().back(),
            (std::map<std::string, std::string>{{"BRENVIK_ROUTINE", "BVMobileHelperCheckIn"}}));
}

TEST_F(ServerTest, ACallerWithoutTheEntitlementGets35AndNoPortAndTheIdleStateIsUnchanged) {
  create();
  countDown();
  clock.advance(5s);
  entitled = false;
  EXPECT_EQ(checkIn(), 35);
  EXPECT_EQ(clientPort, kNullPort);
  EXPECT_EQ(sources.routineSources.size(), 1U);
  EXPECT_EQ(registry.size(), 1U);
  clock.advance(5s);
  EXPECT_TRUE(server->isStopped()) << "the countdown went on";
}

TEST_F(ServerTest, TwoCheckInsGiveTwoIndependentPortsEachTornDownWhenItsWatchedPortDies) {
  create();
  ASSERT_EQ(checkIn(), kern::success);
  const PortName first = clientPort;
  ASSERT_EQ(checkIn(), kern::success);
  const PortName second = clientPort;
  EXPECT_NE(first, second);
  clientDies(0);
  EXPECT_EQ(LookupServer(registry, first), nullptr);
  EXPECT_FALSE(sources.routineSources[1]->valid);
  EXPECT_EQ(LookupServer(registry, second), server.get());
  EXPECT_TRUE(sources.routineSources[2]->valid);
  clientDies(1);
  EXPECT_EQ(registry.size(), 1U) << "only the service port is left";
  EXPECT_EQ(ports.receiveRights.size(), 1U);
  EXPECT_TRUE(ports.sendRights.empty());
}

TEST_F(ServerTest, AClientsRightsGoInTheOrderWatchSourceReceiveSend) {
  create();
  ASSERT_EQ(checkIn(), kern::success);
  std::vector<std::string> order;
  sources.routineSources[1]->whenInvalidated = [&] {
    EXPECT_EQ(ports.sendRights, (std::map<PortName, int>{{clientPort, 1}})) << "the caller's is gone";
    order.push_back("source");
  };
  ports.whenReceiveRightIsDropped = [&](PortName name) {
    EXPECT_EQ(name, clientPort);
    EXPECT_EQ(ports.sendRights.count(clientPort), 1U);
    order.push_back("receive right");
  };
  clientDies(0);
  EXPECT_EQ(order, (std::vector<std::string>{"source", "receive right"}));
  EXPECT_TRUE(ports.sendRights.empty());
  ports.whenReceiveRightIsDropped = {};
}

TEST_F(ServerTest, DeathOfAClientWhileABusyTokenIsHeldDoesNotArmTheTimerButItsReleaseDoes) {
  create();
  ASSERT_EQ(checkIn(), kern::success);
  const auto token = AcquireBusyToken(*server);
  clientDies(0);
  EXPECT_FALSE(idleTimerRuns());
  ReleaseBusyToken(*server, token);
  EXPECT_TRUE(idleTimerRuns());
}

TEST_F(ServerTest, ReleaseOfTheLastTokenWhileAClientIsThereDoesNotArmTheTimerButItsDeathDoes) {
  create();
  ASSERT_EQ(checkIn(), kern::success);
  const auto token = AcquireBusyToken(*server);
  ReleaseBusyToken(*server, token);
  EXPECT_FALSE(idleTimerRuns());
  clientDies(0);
  EXPECT_TRUE(idleTimerRuns());
}

TEST_F(ServerTest, TheSecondToLastClientGoingAwayDoesNotArmTheTimerTheLastOneDoes) {
  create();
  ASSERT_EQ(checkIn(), kern::success);
  ASSERT_EQ(checkIn(), kern::success);
  clientDies(1);
  EXPECT_FALSE(idleTimerRuns());
  clientDies(0);
  EXPECT_TRUE(idleTimerRuns());
}

TEST_F(ServerTest, AFailedPortCallPassesItsCodeThrough) {
  create();
  ports.refuseAllocate = kern::resourceShortage;
  EXPECT_EQ(checkIn(), kern::resourceShortage);
  ports.refuseAllocate = kern::success;
  ports.refuseInsert = kern::noSpace;
  EXPECT_EQ(checkIn(), kern::noSpace);
  EXPECT_EQ(clientPort, kNullPort);
  EXPECT_EQ(ports.receiveRights.size(), 1U);
  EXPECT_EQ(registry.size(), 1U);
}

TEST_F(ServerTest, ASourceOrDeathWatchThatCannotBeMadeGives5AndLeavesNoState) {
  create();
  const auto expectRefusalWithoutState = [&] {
    EXPECT_EQ(checkIn(), kern::failure);
    EXPECT_EQ(clientPort, kNullPort);
    EXPECT_EQ(ports.receiveRights.size(), 1U);
    EXPECT_EQ(ports.sendRights, (std::map<PortName, int>{{callerPort, 1}}))
        << "of the new port none, the caller's stays";
    EXPECT_EQ(ports.failedDrops, 0);
    EXPECT_EQ(registry.size(), 1U);
    EXPECT_EQ(server->facts().clients, 0U);
    ports.sendRights.clear();
  };
  sources.refuseRoutineSources = true;
  expectRefusalWithoutState();
  sources.refuseRoutineSources = false;
  sources.refuseDeathWatches = true;
  expectRefusalWithoutState();
  EXPECT_FALSE(sources.routineSources.back()->valid);
  sources.refuseDeathWatches = false;
  sources.refuseToBeAdded = true;
  expectRefusalWithoutState();
}

TEST_F(ServerTest, TheServerOwnsTheCallersRightFromASuccessfulCheckInOn) {
  create();
  const auto expectRefusalWithoutTheRight = [&] {
    EXPECT_EQ(checkIn(), kern::failure);
    EXPECT_EQ(ports.sendRights, (std::map<PortName, int>{{callerPort, 1}})) << "it stays with the message";
    ports.sendRights.clear();
  };
  sources.refuseDeathWatches = true;
  expectRefusalWithoutTheRight();
  sources.refuseDeathWatches = false;
  sources.refuseToBeAdded = true;
  expectRefusalWithoutTheRight();
  sources.refuseToBeAdded = false;
  ASSERT_EQ(checkIn(), kern::success);
  clientDies(1);
  EXPECT_TRUE(ports.sendRights.empty());
  EXPECT_EQ(ports.failedDrops, 0);
}

TEST_F(ServerTest, ACheckInLeavesNothingWhereverMemoryRunsOut) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "nothing fails under this sanitizer";
  create();
  int failures = 0;
  for (long number = 0;; ++number) {
    callerPort = ports.adoptSendRight();
    sources.routineSources.reserve(64);
    sources.deathWatches.reserve(64);
    bool isDone = true;
    try {
      const FailingAllocations failing(number, FailingAllocations::HowMany::one);
      isDone = server->admit(callerPort, &clientPort, AuditToken{}) == kern::success;
    } catch (const std::bad_alloc&) {
      isDone = false;
      ++failures;
    }
    if (isDone) break;
    EXPECT_EQ(registry.size(), 1U) << number;
    EXPECT_EQ(ports.receiveRights.size(), 1U) << number;
    EXPECT_EQ(ports.sendRights, (std::map<PortName, int>{{callerPort, 1}})) << number;
    EXPECT_EQ(server->facts().clients, 0U) << number;
    ports.sendRights.clear();
  }
  EXPECT_GE(failures, 4) << "the client, two names in the registry, the entry";
  EXPECT_EQ(server->facts().clients, 1U);
}

TEST_F(ServerTest, ACallerWhosePortIsAlreadyDeadGets5AndIsTornDownByTheCallback) {
  create();
  countDown();
  sources.portsAreDead = true;
  EXPECT_EQ(checkIn(), kern::failure);
  EXPECT_EQ(clientPort, kNullPort);
  EXPECT_EQ(server->facts().clients, 1U) << "the entries stay for the callback";
  EXPECT_FALSE(idleTimerRuns()) << "the countdown ended";
  clientDies(0);
  EXPECT_EQ(server->facts().clients, 0U);
  EXPECT_TRUE(idleTimerRuns());
}

TEST_F(ServerTest, ADeathWithoutAContextIsTheServersThatOwnsTheWatchedPort) {
  create();
  ASSERT_EQ(checkIn(), kern::success);
  OnClientPortDied(*sources.deathWatches[0], nullptr, registry);
  EXPECT_EQ(server->facts().clients, 0U);
}

TEST_F(ServerTest, ADeathThatBelongsToNoServerStopsTheProcessOnAnAssertion) {
  create();
  FakeDeathWatch stray(0x777);
  EXPECT_EXIT(
      {
        class StandardError final : public LogSink {
          void unified(LogLevel, std::string_view line, const LogPlace&, const MessageId&) noexcept override {
            std::fprintf(stderr, "%.*s\n", static_cast<int>(line.size()), line.data());
          }
          void bsd(SyslogPriority, std::string_view, const MessageId&) noexcept override {}
        } sink;
        setLogSink(&sink);
        OnClientPortDied(stray, nullptr, registry);
      },
      testing::KilledBySignal(SIGABRT),
      "Assertion failed: \\(server\\), function MachPortInvalidationCallBack, file HelperServerUtils, line "
      "317");
}

// ---- the check-in handler: form first, then the routine ----

class CheckInHandlerTest : public ServerTest {
 protected:
  void SetUp() override {
    create();
    message.header.bits = kComplexBit | kReplyDisposition;
    message.header.size = sizeof message;
    message.header.replyPort = 7;
    message.header.localPort = server->servicePort();
    message.header.id = kCheckInRoutine.id;
    message.descriptorCount = 1;
    message.clientPort.name = ports.adoptSendRight();
    message.clientPort.disposition = kDispositionMoveSend;
    trailer.size = sizeof trailer;
  }
  // The code of a status reply, or 0 with `answer` holding the check-in reply.
  KernelReturn deliver(std::uint32_t size = sizeof(CheckInRequest)) {
    const auto& table = sources.routineSources.at(0)->table;
    std::memset(&answer, 0, sizeof answer);
    const Request request(reinterpret_cast<std::byte*>(&message), size, &trailer);
    Reply reply(reinterpret_cast<std::byte*>(&answer));
    const Outcome outcome = table.find(kCheckInRoutine.id)(table.context(), request, reply);
    const auto& status = *reinterpret_cast<const StatusReply*>(&answer);
    if ((answer.header.bits & kComplexBit) != 0) {
      EXPECT_EQ(outcome, Outcome::accepted);
      return kern::success;
    }
    EXPECT_EQ(outcome, Outcome::refused);
    EXPECT_EQ(status.header.size, 36U);
    EXPECT_EQ(std::memcmp(&status.ndr, &kNdrRecord, sizeof kNdrRecord), 0);
    return status.returnCode;
  }
  struct {
    CheckInRequest request;
    std::byte more[8];
  } padded{};
  CheckInRequest& message = padded.request;
  MessageTrailer trailer{};
  CheckInReply answer{};
};

TEST_F(CheckInHandlerTest, AGoodCheckInIsAnsweredWithTheClientsPortAsACopySendRight) {
  EXPECT_EQ(deliver(), kern::success);
  EXPECT_EQ(answer.header.size, 40U);
  EXPECT_EQ(answer.descriptorCount, 1U);
  EXPECT_EQ(answer.servicePort.disposition, 19);
  EXPECT_EQ(answer.servicePort.type, 0);
  EXPECT_EQ(LookupServer(registry, answer.servicePort.name), server.get());
}

TEST_F(CheckInHandlerTest, SizeComplexFlagOrCountThatIsWrongGetsMinus304) {
  EXPECT_EQ(deliver(39), -304);
  EXPECT_EQ(deliver(41), -304);
  message.descriptorCount = 2;
  EXPECT_EQ(deliver(), -304);
  message.descriptorCount = 1;
  message.header.bits = kReplyDisposition;
  EXPECT_EQ(deliver(), -304);
}

TEST_F(CheckInHandlerTest, ACheckInWhoseDescriptorCarriesACopySendInsteadOfAMoveSendGetsMinus300) {
  message.clientPort.disposition = 19;
  EXPECT_EQ(deliver(), -300);
  message.clientPort.disposition = 17;
  message.clientPort.type = 1;
  EXPECT_EQ(deliver(), -300);
}

TEST_F(CheckInHandlerTest, ACheckInReceivedWithoutTheAuditTrailerGetsMinus309) {
  trailer.size = kMinimalTrailerSize;
  EXPECT_EQ(deliver(), -309);
  trailer.size = 31;
  EXPECT_EQ(deliver(), -309);
  trailer.size = sizeof trailer;
  trailer.type = 1;
  EXPECT_EQ(deliver(), -309);
}

TEST_F(CheckInHandlerTest, ATrailerThatJustHoldsATokenIsEnough) {
  trailer.size = 32;
  EXPECT_EQ(deliver(), kern::success);
}

TEST_F(CheckInHandlerTest, TheEntitlementIsAskedForTheCallerOfTheTrailer) {
  const std::array<std::uint32_t, 8> words{11, 12, 13, 14, 15, 16, 17, 18};
  static_assert(sizeof words == sizeof trailer.auditToken);
  std::memcpy(&trailer.auditToken, words.data(), sizeof words);
  EXPECT_EQ(deliver(), kern::success);
  EXPECT_EQ(askedEntitlement, kAllowEntitlement);
  EXPECT_TRUE(std::equal(words.begin(), words.end(), askedCaller.words.begin(), askedCaller.words.end()));
}

TEST_F(CheckInHandlerTest, FormIsCheckedBeforeTheDescriptorAndTheDescriptorBeforeTheTrailer) {
  trailer.size = 8;
  message.clientPort.disposition = 19;
  EXPECT_EQ(deliver(41), -304);
  EXPECT_EQ(deliver(), -300);
}

TEST_F(CheckInHandlerTest, ARefusedCallerGetsItsStatusAlone) {
  entitled = false;
  EXPECT_EQ(deliver(), 35);
}

}  // namespace
}  // namespace brenvik
