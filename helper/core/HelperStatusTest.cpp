// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/core/HelperStatus.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <cerrno>
#include <future>
#include <memory>

#include "helper/heartbeat/EchoMessage.h"
#include "platform/ipc/fakes/FakePorts.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/net/fakes/FakeEchoNetwork.h"
#include "platform/runloop/fakes/ManualRunLoop.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

class HelperStatusTest : public testing::Test {
 protected:
  void clientComes() {
    PortName port = kNullPort;
    ASSERT_EQ(BVMobileHelperCheckIn(platform, server->servicePort(), ports.adoptSendRight(), &port, {}), 0);
  }
  void clientGoes() { sources.deathWatches.back()->tellDeath(); }

  ManualClock clock;
  std::chrono::nanoseconds late{0};  // how far the run loop is behind the time
  ManualRunLoop loop{clock};
  FakePortSpace ports;
  FakeBootstrap bootstrap{ports};
  FakePortSources sources;
  PortServerRegistry registry;
  ServerPlatform platform{.ports = ports,
                          .bootstrap = bootstrap,
                          .sources = sources,
                          .loop = loop,
                          .hasEntitlement = [](const char*, const AuditToken&) { return true; },
                          .registry = registry,
                          .now = [this] { return clock.now() + late; }};
  NoRoutines routines;
  RecordingLog log;
  std::unique_ptr<ServerContext> server = CreateServer(platform, kServiceName, routines);
  std::shared_ptr<LASDUpdater> lasd = std::make_shared<LASDUpdater>();
  CellularHeartbeat heartbeat;
  GeoRequestState location;
  std::vector<StatusReport::Worker> workers;
  ProgramFacts program{"/usr/libexec/helper", true};
  HelperStatus status{{.server = *server,
                       .lasd = *lasd,
                       .heartbeat = heartbeat,
                       .location = location,
                       .version = "1.2.3",
                       .socket = "/run/service",
                       .workers = [this] { return workers; },
                       .program = [this] { return program; },
                       .now = [this] { return clock.now(); }}};
};

TEST_F(HelperStatusTest, AHelperThatHasJustBegunWaitsForItsFirstClient) {
  clock.advance(1500ms);
  StatusReport wanted;
  wanted.version = "1.2.3";
  wanted.process = static_cast<std::uint64_t>(::getpid());
  wanted.executable = "/usr/libexec/helper";
  wanted.isReplaced = true;
  wanted.socket = "/run/service";
  wanted.running = 1500ms;
  EXPECT_EQ(status.report(), wanted);
  EXPECT_EQ(status.line(), "Waits for its first client");
}

TEST_F(HelperStatusTest, ClientsTokensAndTheCountdownAreTold) {
  clientComes();
  const auto check = AcquireBusyToken(*server, StatusReport::kDatabaseCheck);
  const auto again = AcquireBusyToken(*server, StatusReport::kDatabaseCheck);
  const auto beat = AcquireBusyToken(*server, StatusReport::kHeartbeat);
  StatusReport told = status.report();
  EXPECT_EQ(told.clients, 1U);
  EXPECT_EQ(told.busyTokens, 3U);
  EXPECT_EQ(told.busy, (std::vector<StatusReport::Busy>{{"database-check", 2}, {"heartbeat", 1}}));
  EXPECT_FALSE(told.leavesIn);
  EXPECT_EQ(status.line(),
            "Kept by 1 client, a database check, a heartbeat that was switched on more than once");
  for (const auto each : {check, again, beat}) EXPECT_EQ(ReleaseBusyToken(*server, each), 1U);
  clientGoes();
  clock.advance(3s);
  told = status.report();
  EXPECT_EQ(told.clients, 0U);
  EXPECT_TRUE(told.busy.empty());
  EXPECT_EQ(told.leavesIn, 7000ms);
  EXPECT_EQ(status.line(), "Idle, leaves soon");
}

TEST_F(HelperStatusTest, AHostedServerThatIsBusyIsNamedAndTheCountdownBeginsAnew) {
  SetIdleCheck(server.get(), [] { return true; });
  clientComes();
  clientGoes();
  EXPECT_FALSE(status.report().isKeptByBaseband);
  clock.advance(10s);
  StatusReport told = status.report();
  EXPECT_TRUE(told.isKeptByBaseband);
  EXPECT_EQ(told.leavesIn, 10000ms);
  clientComes();
  EXPECT_FALSE(status.report().isKeptByBaseband);
}

TEST_F(HelperStatusTest, ATickThatIsDueAndHasNotComeLeavesNoTime) {
  SetIdleCheck(server.get(), [] { return true; });
  clientComes();
  clientGoes();
  for (int tick = 0; tick < 2; ++tick) {
    clock.advance(9990ms);
    late = 50ms;
    EXPECT_EQ(status.report().leavesIn, 0ms);
    late = 0ms;
    clock.advance(10ms);
    EXPECT_EQ(status.report().leavesIn, 10000ms);
  }
}

TEST_F(HelperStatusTest, HowLocationRequestsEndedIsToldWithoutAnyPlace) {
  clock.advance(5s);
  const std::pair<GeoRequestState::Ending, const char*> endings[] = {
      {GeoRequestState::Ending::answered, "answered"},
      {GeoRequestState::Ending::failed, "failed"},
      {GeoRequestState::Ending::timedOut, "timed-out"}};
  for (const auto& [ending, name] : endings) {
    location.noteEnding(ending, clock.now());
    clock.advance(2s);
    EXPECT_EQ(status.report().locationAnswer, (StatusReport::Event{name, 2000ms}));
  }
}

TEST_F(HelperStatusTest, WhatTheHeartbeatSentAndReceivedIsTold) {
  ManualWorkQueues queues{clock};
  FakeEchoNetwork network;
  heartbeat.configure({queues, network, "203.0.113.9"});
  const EchoMessage request = makeEchoRequest(static_cast<std::uint16_t>(::getpid() & 0xFFFF), timeval{});
  std::vector<std::byte> reply(request.begin(), request.end());
  reply[0] = std::byte{0};
  network.arrivals.push_back({30ms, reply, 0});
  EXPECT_EQ(heartbeat.ping(), 0);
  EXPECT_EQ(heartbeat.ping(), ETIMEDOUT);
  const StatusReport told = status.report();
  EXPECT_EQ(told.heartbeatSent, (StatusReport::Traffic{2, 2 * request.size()}));
  EXPECT_EQ(told.heartbeatReceived, (StatusReport::Traffic{1, request.size()}));
  heartbeat.shutDown();
}

TEST_F(HelperStatusTest, WorkersAreToldAsTheyAre) {
  workers = {{"network", true}, {"stores", false}};
  EXPECT_EQ(status.report().workers, workers);
}

TEST_F(HelperStatusTest, EveryChangeIsToldWithNoLockHeld) {
  DestroyServer(std::move(server));
  int changes = 0;
  ServerPlatform listening{.ports = ports,
                           .bootstrap = bootstrap,
                           .sources = sources,
                           .loop = loop,
                           .hasEntitlement = [](const char*, const AuditToken&) { return true; },
                           .registry = registry,
                           .onChange =
                               [&] {
                                 ++changes;
                                 const auto facts = std::async([&] { return server->facts(); });
                                 EXPECT_EQ(facts.wait_for(10s), std::future_status::ready);
                               }};
  server = CreateServer(listening, kServiceName, routines);
  PortName port = kNullPort;
  ASSERT_EQ(BVMobileHelperCheckIn(listening, server->servicePort(), ports.adoptSendRight(), &port, {}), 0);
  EXPECT_EQ(changes, 1);
  clientGoes();
  EXPECT_EQ(changes, 2);
  const auto token = AcquireBusyToken(*server);
  EXPECT_EQ(changes, 3);
  (void)ReleaseBusyToken(*server, token);
  EXPECT_EQ(changes, 4);
  DestroyServer(std::move(server));
}

}  // namespace
}  // namespace brenvik
