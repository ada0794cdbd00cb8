// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/heartbeat/CellularHeartbeat.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstring>

#include "Helper/Shared/Server/HelperServerUtils.h"
#include "helper/heartbeat/EchoMessage.h"
#include "platform/ipc/fakes/FakePorts.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/net/fakes/FakeEchoNetwork.h"
#include "platform/runloop/fakes/ManualRunLoop.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

using Lines = std::vector<RecordingLog::Entry>;

std::uint16_t ourIdentifier() { return static_cast<std::uint16_t>(::getpid() & 0xFFFF); }

std::vector<std::byte> echoReply(std::uint16_t identifier) {
  const EchoMessage request = makeEchoRequest(identifier, timeval{});
  std::vector<std::byte> reply(request.begin(), request.end());
  reply[0] = std::byte{0};
  return reply;
}

class CellularHeartbeatTest : public testing::Test {
 protected:
  CellularHeartbeatTest() { heartbeat.configure({queues, network, "203.0.113.9"}); }
  ~CellularHeartbeatTest() override { heartbeat.shutDown(); }

  void use(std::string address) { heartbeat.configure({queues, network, std::move(address)}); }
  void replyArrives(std::chrono::microseconds after, std::vector<std::byte> datagram) {
    network.arrivals.push_back({after, std::move(datagram), 0});
  }
  // Runs the heartbeat's queue, if it has one by now.
  void runQueue() {
    for (auto& queue : queues.serial) queue->runReady();
  }
  void advance(std::chrono::nanoseconds by) {
    clock.advance(by);
    runQueue();
  }
  bool idleTimerRuns() const { return server.isCountingDown(); }

  ManualClock clock;
  ManualRunLoop loop{clock};
  ManualWorkQueues queues{clock};
  FakePortSpace ports;
  FakeBootstrap bootstrap{ports};
  FakePortSources sources;
  PortServerRegistry registry;
  NoRoutines routines;
  const std::unique_ptr<ServerContext> owned =
      CreateServer(ServerPlatform{ports, bootstrap, sources, loop,
                                  [](const char*, const AuditToken&) { return true; }, registry},
                   kServiceName, routines);
  ServerContext& server = *owned;
  FakeEchoNetwork network;
  RecordingLog log;
  CellularHeartbeat heartbeat;
};

// ---- the probe ----

TEST_F(CellularHeartbeatTest, AProbeSendsOneRequestWithOurIdentifierAndEndsAtItsReply) {
  replyArrives(30ms, echoReply(ourIdentifier()));
  EXPECT_EQ(heartbeat.ping(), 0);
  ASSERT_EQ(network.opened, (std::vector<std::pair<int, std::uint16_t>>{{1, ourIdentifier()}}));
  ASSERT_EQ(network.sent.size(), 1U);
  const EchoMessage expected = makeEchoRequest(ourIdentifier(), network.wallClock);
  EXPECT_TRUE(std::equal(network.sent[0].begin(), network.sent[0].end(), expected.begin(), expected.end()));
  EXPECT_EQ(network.destination.s_addr, ::inet_addr("203.0.113.9"));
  EXPECT_EQ(network.elapsed, 30ms);
  EXPECT_EQ(network.openSockets, 0);
  EXPECT_TRUE(network.namesAsked.empty()) << "an address needs no look-up";
}

TEST_F(CellularHeartbeatTest, WhatGoesOutAndComesBackIsCounted) {
  const std::size_t size = makeEchoRequest(0, timeval{}).size();
  replyArrives(30ms, echoReply(ourIdentifier()));
  EXPECT_EQ(heartbeat.ping(), 0);
  EXPECT_EQ(heartbeat.ping(), ETIMEDOUT);
  EXPECT_EQ(heartbeat.sent().packets, 2U);
  EXPECT_EQ(heartbeat.sent().bytes, 2 * size);
  EXPECT_EQ(heartbeat.received().packets, 1U);
  EXPECT_EQ(heartbeat.received().bytes, size);
  network.sendError = ENETUNREACH;
  EXPECT_EQ(heartbeat.ping(), ENETUNREACH);
  EXPECT_EQ(heartbeat.sent().packets, 2U);
}

TEST_F(CellularHeartbeatTest, AProbeThatMemoryDoesNotSufficeForEndsAndTheNextOneGoesOut) {
  network.isWithoutMemory = true;
  EXPECT_EQ(heartbeat.ping(), ENOMEM);
  network.isWithoutMemory = false;
  EXPECT_EQ(heartbeat.ping(), ETIMEDOUT);
  EXPECT_EQ(network.sent.size(), 1U);
}

TEST_F(CellularHeartbeatTest, WhetherItIsOnIsTold) {
  EXPECT_FALSE(heartbeat.isOn());
  heartbeat.setHeartbeat(server, true);
  runQueue();
  EXPECT_TRUE(heartbeat.isOn());
  heartbeat.setHeartbeat(server, false);
  runQueue();
  EXPECT_FALSE(heartbeat.isOn());
  queues.serial.at(0)->timers = ManualWorkQueue::Timers::cannotBeArmed;
  heartbeat.setHeartbeat(server, true);
  runQueue();
  EXPECT_FALSE(heartbeat.isOn());
}

TEST_F(CellularHeartbeatTest, TheSocketIsSetUpInOrderAndBoundToTheCellularInterface) {
  network.cellularIndex = 7;
  replyArrives(0ms, echoReply(ourIdentifier()));
  EXPECT_EQ(heartbeat.ping(), 0);
  EXPECT_EQ(network.calls,
            (std::vector<std::string>{"buffer 51200", "interface 7", "time-out 1000000", "send"}));
}

TEST_F(CellularHeartbeatTest, WithoutTheCellularInterfaceTheProbeIsStillSentUnbound) {
  replyArrives(0ms, echoReply(ourIdentifier()));
  EXPECT_EQ(heartbeat.ping(), 0);
  EXPECT_EQ(network.calls, (std::vector<std::string>{"buffer 51200", "time-out 1000000", "send"}));
}

TEST_F(CellularHeartbeatTest, AnAddressThatIsNoTextOrTooLongIsInvalid) {
  use("\xFF\xFE");
  EXPECT_EQ(heartbeat.ping(), EINVAL);
  use(std::string(256, '1'));
  EXPECT_EQ(heartbeat.ping(), EINVAL);
  EXPECT_TRUE(network.namesAsked.empty());
  use(std::string(255, '1'));
  EXPECT_EQ(heartbeat.ping(), EHOSTUNREACH) << "fits, and names no host";
  EXPECT_EQ(network.namesAsked, std::vector{std::string(255, '1')});
  EXPECT_TRUE(network.opened.empty());
}

TEST_F(CellularHeartbeatTest, ANameIsLookedUpAndAnUnknownOneIsUnreachable) {
  use("probe.example");
  EXPECT_EQ(heartbeat.ping(), EHOSTUNREACH);
  network.hostAddress = in_addr{::inet_addr("198.51.100.4")};
  replyArrives(0ms, echoReply(ourIdentifier()));
  EXPECT_EQ(heartbeat.ping(), 0);
  EXPECT_EQ(network.destination.s_addr, ::inet_addr("198.51.100.4"));
  EXPECT_EQ(network.namesAsked, (std::vector<std::string>{"probe.example", "probe.example"}));
}

TEST_F(CellularHeartbeatTest, TheBroadcastAddressIsTakenForAName) {
  use("255.255.255.255");
  EXPECT_EQ(heartbeat.ping(), EHOSTUNREACH);
  EXPECT_EQ(network.namesAsked, std::vector<std::string>{"255.255.255.255"});
}

TEST_F(CellularHeartbeatTest, AnUnknownProtocolIsNotSupported) {
  network.icmpNumber.reset();
  EXPECT_EQ(heartbeat.ping(), EPFNOSUPPORT);
  EXPECT_TRUE(network.opened.empty());
}

TEST_F(CellularHeartbeatTest, ARefusedSocketIsNotPermitted) {
  network.refuseSockets = true;
  EXPECT_EQ(heartbeat.ping(), EPERM);
}

TEST_F(CellularHeartbeatTest, ARefusedReceiveTimeOutFailsWithItsErrorAndSendsNothing) {
  network.timeOutError = EDOM;
  EXPECT_EQ(heartbeat.ping(), EDOM);
  EXPECT_TRUE(network.sent.empty());
  EXPECT_EQ(network.openSockets, 0);
}

TEST_F(CellularHeartbeatTest, AFailingClockFailsWithItsErrorOr1) {
  network.clockFailures = 2;
  network.clockError = EFAULT;
  EXPECT_EQ(heartbeat.ping(), EFAULT);
  network.clockError = 0;
  EXPECT_EQ(heartbeat.ping(), 1);
  EXPECT_TRUE(network.sent.empty());
  EXPECT_EQ(network.openSockets, 0);
}

TEST_F(CellularHeartbeatTest, ASendThatFailsOrIsCutFailsWithItsErrorOr1) {
  network.sendError = ENETUNREACH;
  EXPECT_EQ(heartbeat.ping(), ENETUNREACH);
  network.sendError = 0;
  network.sendCount = 47;
  EXPECT_EQ(heartbeat.ping(), 1);
  EXPECT_EQ(network.elapsed, 0s) << "neither waits for a reply";
  EXPECT_EQ(network.openSockets, 0);
}

TEST_F(CellularHeartbeatTest, SilenceTimesOutAfterTwoSeconds) {
  EXPECT_EQ(heartbeat.ping(), ETIMEDOUT);
  EXPECT_EQ(network.elapsed, 2s) << "the second begins when the first receive returns";
}

TEST_F(CellularHeartbeatTest, EchoRepliesForOtherProcessesAreSkippedAndTheLoopKeepsWaiting) {
  const auto stranger = echoReply(static_cast<std::uint16_t>(ourIdentifier() + 1));
  replyArrives(100ms, stranger);
  replyArrives(100ms, stranger);
  replyArrives(100ms, echoReply(ourIdentifier()));
  EXPECT_EQ(heartbeat.ping(), 0);
  EXPECT_EQ(network.elapsed, 300ms);
}

TEST_F(CellularHeartbeatTest, StrangersRepliesDoNotProlongTheWait) {
  const auto stranger = echoReply(static_cast<std::uint16_t>(ourIdentifier() + 1));
  for (int i = 0; i < 30; ++i) replyArrives(100ms, stranger);
  EXPECT_EQ(heartbeat.ping(), ETIMEDOUT);
  EXPECT_EQ(network.elapsed, 1100ms) << "a second after the first of them";
}

TEST_F(CellularHeartbeatTest, AReplyShorterThan48BytesAfterTheIpHeaderDoesNotMatch) {
  auto tooShort = echoReply(ourIdentifier());
  tooShort.pop_back();
  replyArrives(10ms, tooShort);
  EXPECT_EQ(heartbeat.ping(), ETIMEDOUT);
  network.raw = true;
  std::vector<std::byte> withHeader(20);
  withHeader[0] = std::byte{0x45};
  withHeader.insert(withHeader.end(), tooShort.begin(), tooShort.end());
  replyArrives(10ms, withHeader);
  EXPECT_EQ(heartbeat.ping(), ETIMEDOUT);
  withHeader.push_back(std::byte{0});
  replyArrives(10ms, withHeader);
  EXPECT_EQ(heartbeat.ping(), 0);
}

TEST_F(CellularHeartbeatTest, ALateReplyStillCountsWithinTheSecondSecond) {
  replyArrives(1900ms, echoReply(ourIdentifier()));
  EXPECT_EQ(heartbeat.ping(), 0);
  EXPECT_EQ(network.elapsed, 1900ms);
}

TEST_F(CellularHeartbeatTest, AReplyLaterThanThatIsNotWaitedFor) {
  replyArrives(2100ms, echoReply(ourIdentifier()));
  EXPECT_EQ(heartbeat.ping(), ETIMEDOUT);
  EXPECT_EQ(network.elapsed, 2s);
}

TEST_F(CellularHeartbeatTest, AReceiveErrorOtherThanItsTimeOutEndsTheProbeWithIt) {
  network.arrivals.push_back({300ms, {}, ECONNREFUSED});
  EXPECT_EQ(heartbeat.ping(), ECONNREFUSED);
  EXPECT_EQ(network.elapsed, 300ms);
}

TEST_F(CellularHeartbeatTest, AnEmptyDatagramIsSkipped) {
  replyArrives(10ms, {});
  network.raw = true;
  EXPECT_EQ(heartbeat.ping(), ETIMEDOUT);
}

// ---- on and off ----

TEST_F(CellularHeartbeatTest, SwitchingReturnsAtOnceAndTheWorkIsDoneOnItsOwnQueue) {
  EXPECT_TRUE(queues.serial.empty()) << "nothing is made before it is needed";
  heartbeat.setHeartbeat(server, true);
  ASSERT_EQ(queues.serial.size(), 1U);
  EXPECT_EQ(queues.serial[0]->label(), "com.norvale.otaheartbeat");
  EXPECT_TRUE(network.opened.empty());
  EXPECT_EQ(server.busyMask(), 0U);
  runQueue();
  EXPECT_EQ(network.sent.size(), 1U) << "one probe within start itself";
  EXPECT_EQ(server.busyMask(), 1U);
  heartbeat.setHeartbeat(server, false);
  EXPECT_EQ(queues.serial.size(), 1U);
}

TEST_F(CellularHeartbeatTest, OneProbeAtStartOneAtTheFirstFiringThenEveryTwoSeconds) {
  heartbeat.setHeartbeat(server, true);
  runQueue();
  EXPECT_EQ(network.sent.size(), 1U);
  advance(0s);
  EXPECT_EQ(network.sent.size(), 2U);
  advance(1999ms);
  EXPECT_EQ(network.sent.size(), 2U);
  advance(1ms);
  EXPECT_EQ(network.sent.size(), 3U);
  for (int i = 0; i < 5; ++i) advance(2s);
  EXPECT_EQ(network.sent.size(), 8U);
}

TEST_F(CellularHeartbeatTest, ItHoldsABusyTokenUntilItIsSwitchedOff) {
  heartbeat.setHeartbeat(server, true);
  runQueue();
  EXPECT_EQ(server.busyMask(), 1U);
  EXPECT_FALSE(idleTimerRuns());
  heartbeat.setHeartbeat(server, false);
  runQueue();
  EXPECT_EQ(server.busyMask(), 0U);
  EXPECT_TRUE(idleTimerRuns()) << "no client and no token: the countdown begins";
  const auto probes = network.sent.size();
  advance(9s);
  EXPECT_EQ(network.sent.size(), probes);
}

TEST_F(CellularHeartbeatTest, StartedTwiceTheFirstTokenStaysHeld) {
  heartbeat.setHeartbeat(server, true);
  heartbeat.setHeartbeat(server, true);
  runQueue();
  EXPECT_EQ(server.busyMask(), 3U);
  advance(0s);
  EXPECT_EQ(network.sent.size(), 3U) << "two starts, and one timer only";
  heartbeat.setHeartbeat(server, false);
  runQueue();
  EXPECT_EQ(server.busyMask(), 1U);
  EXPECT_FALSE(idleTimerRuns());
  heartbeat.setHeartbeat(server, false);
  runQueue();
  EXPECT_EQ(server.busyMask(), 1U) << "a second stop has only token 0 to give";
}

TEST_F(CellularHeartbeatTest, WithoutATimerThatCanBeMadeOrArmedItIsOffAndHoldsNoToken) {
  const Lines off{
      RecordingLog::unifiedLine(LogLevel::error, "The cellular heartbeat is off: its timer cannot be armed")};
  for (const auto timers : {ManualWorkQueue::Timers::cannotBeMade, ManualWorkQueue::Timers::cannotBeArmed}) {
    log.clear();
    heartbeat.setHeartbeat(server, true);
    queues.serial.at(0)->timers = timers;
    runQueue();
    EXPECT_EQ(server.busyMask(), 0U);
    EXPECT_EQ(log.entries(), off);
    const auto probes = network.sent.size();
    advance(8s);
    EXPECT_EQ(network.sent.size(), probes);
  }
  EXPECT_TRUE(idleTimerRuns());
  queues.serial[0]->timers = ManualWorkQueue::Timers::work;
  heartbeat.setHeartbeat(server, true);
  runQueue();
  EXPECT_EQ(server.busyMask(), 1U);
}

TEST_F(CellularHeartbeatTest, ARunningHeartbeatWhoseNewTimerCannotBeMadeGivesItsTokenBackToo) {
  heartbeat.setHeartbeat(server, true);
  runQueue();
  ASSERT_EQ(server.busyMask(), 1U);
  queues.serial[0]->timers = ManualWorkQueue::Timers::cannotBeMade;
  heartbeat.setHeartbeat(server, true);
  runQueue();
  EXPECT_EQ(server.busyMask(), 0U);
  EXPECT_EQ(log.entries().size(), 1U);
}

TEST_F(CellularHeartbeatTest, ItsTicksMayBePutOffByFiveMicrosecondsAtMost) {
  heartbeat.setHeartbeat(server, true);
  runQueue();
  EXPECT_EQ(queues.serial.at(0)->leeways, std::vector<std::chrono::nanoseconds>{5'000ns});
}

TEST_F(CellularHeartbeatTest, StopWithoutAPriorStartReleasesToken0WhichIsRefused) {
  const std::uint32_t other = AcquireBusyToken(server);
  heartbeat.setHeartbeat(server, false);
  runQueue();
  EXPECT_EQ(server.busyMask(), other);
  ReleaseBusyToken(server, other);
  EXPECT_TRUE(idleTimerRuns());
}

TEST_F(CellularHeartbeatTest, AStopWithoutAStartDoesNotBeginTheIdleCountdown) {
  heartbeat.setHeartbeat(server, false);
  runQueue();
  EXPECT_FALSE(idleTimerRuns());
}

TEST_F(CellularHeartbeatTest, FailuresEndSingleProbesOnlyAndNothingIsLogged) {
  network.refuseSockets = true;
  heartbeat.setHeartbeat(server, true);
  runQueue();
  advance(0s);
  advance(2s);
  EXPECT_EQ(network.opened.size(), 3U);
  network.refuseSockets = false;
  advance(2s);
  EXPECT_EQ(network.sent.size(), 1U);
  EXPECT_EQ(server.busyMask(), 1U);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(CellularHeartbeatTest, TheProcessHasOneThatExistsWithoutAQueue) {
  EXPECT_EQ(&CellularHeartbeat::shared(), &CellularHeartbeat::shared());
  EXPECT_NE(::inet_addr(kReachabilityAddress), INADDR_NONE);
}

}  // namespace
}  // namespace brenvik
