// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/requests/RequestAreas.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <string>
#include <tuple>
#include <vector>

#include "platform/ipc/fakes/FakePorts.h"
#include "platform/log/Log.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/messageport/fakes/RecordingMessagePorts.h"
#include "platform/net/fakes/FakeEchoNetwork.h"
#include "platform/preferences/fakes/InMemoryPreferences.h"
#include "platform/runloop/fakes/ManualRunLoop.h"
#include "platform/web/fakes/ScriptedWebClient.h"

namespace brenvik {
namespace {

struct Letters {
  KernelReturn withPort(PortName port, char* text, std::uint8_t* success) noexcept {
    called = text + std::to_string(port);
    *success = 1;
    return 21;
  }
  KernelReturn withoutPort(const char* first, const char* second) {
    called = std::string(first) + second;
    return 22;
  }
  KernelReturn copy(const char* from, char* to) {
    to[0] = from[0];
    return 24;
  }
  std::string called;
};
struct Numbers {
  ServerContext* server = nullptr;
  std::int32_t value = 0;
};
KernelReturn withServer(Numbers& numbers, ServerContext& server, std::int32_t value) {
  numbers = {&server, value};
  return 23;
}

class RequestAreasTest : public testing::Test {
 protected:
  static constexpr PortName kPort = 7;
  char first[4] = "one";
  char second[4] = "two";
  ManualClock clock;
  ManualRunLoop loop{clock};
  FakePortSpace ports;
  FakeBootstrap bootstrap{ports};
  FakePortSources sources;
  NoRoutines routines;
  PortServerRegistry registry;
  const std::unique_ptr<ServerContext> server =
      CreateServer(ServerPlatform{ports, bootstrap, sources, loop,
                                  [](const char*, const AuditToken&) { return true; }, registry},
                   "service", routines);
  Letters letters;
  Numbers numbers;
  AreasByReference<Letters, Numbers> areas{registry, letters, numbers};
};

TEST_F(RequestAreasTest, ARoutineThatTakesThePortGetsItThenItsArgumentsThenThePlaceOfItsResult) {
  std::uint8_t success = 0;
  EXPECT_EQ(areas.call<&Letters::withPort>(kPort, std::tie(first), &success), 21);
  EXPECT_EQ(letters.called, "one7");
  EXPECT_EQ(success, 1);
}

TEST_F(RequestAreasTest, ARoutineThatTakesNoPortGetsItsArgumentsAlone) {
  EXPECT_EQ(areas.call<&Letters::withoutPort>(kPort, std::tie(first, second)), 22);
  EXPECT_EQ(letters.called, "onetwo");
}

TEST_F(RequestAreasTest, ThePlaceOfTheResultComesAfterTheArgumentsWhereThePortIsNotTaken) {
  EXPECT_EQ(areas.call<&Letters::copy>(kPort, std::tie(first), &second[0]), 24);
  EXPECT_STREQ(first, "one");
  EXPECT_STREQ(second, "owo");
}

TEST_F(RequestAreasTest, ARoutineThatTakesAServerGetsTheOneOfThePortAndWithoutOneFails) {
  const std::tuple<std::int32_t> arguments{-5};
  EXPECT_EQ(areas.call<&withServer>(kPort, arguments), kern::failure);
  EXPECT_EQ(numbers.server, nullptr);

  EXPECT_EQ(areas.call<&withServer>(server->servicePort(), arguments), 23);
  EXPECT_EQ(numbers.server, server.get());
  EXPECT_EQ(numbers.value, -5);
}

TEST_F(RequestAreasTest, TheHeartbeatIsSwitchedOnByAnyNumberButZero) {
  ManualWorkQueues queues{clock};
  FakeEchoNetwork network;
  CellularHeartbeat heartbeat;
  heartbeat.configure({queues, network, "203.0.113.9"});
  AreasByReference<CellularHeartbeat> heartbeats{registry, heartbeat};
  const auto request = [&](std::int32_t value) {
    EXPECT_EQ((heartbeats.call<&cellularHeartbeat>(server->servicePort(), std::tuple(value))), kern::success);
    queues.serial.at(0)->runReady();
    EXPECT_EQ(server->busyMask() != 0, heartbeat.isOn());
    return heartbeat.isOn();
  };
  EXPECT_FALSE(request(0));
  for (const std::int32_t on : {1, 2, -1, 256, INT32_MIN}) {
    EXPECT_TRUE(request(on)) << on;
    EXPECT_FALSE(request(0)) << on;
  }
  heartbeat.shutDown();
}

// Nothing is downloaded here.
class NoGunzip final : public Gunzip {
 public:
  GunzipOutcome gunzipInto(const GunzipInput&, int, std::uint64_t, std::uint64_t) noexcept override {
    return {};
  }
};

TEST_F(RequestAreasTest, AnUpdateCheckBeginsForTheDatabasesOfTheMask) {
  RecordingLog log;
  ManualWorkQueues queues{clock};
  ScriptedWebClient web;
  NoGunzip gunzip;
  InMemoryPreferences preferences;
  RecordingMessagePorts messagePorts;
  const auto updater = std::make_shared<LASDUpdater>();
  updater->configure({queues, web, gunzip, preferences, messagePorts});
  AreasByReference<LASDUpdater> updaters{registry, *updater};
  EXPECT_EQ(server->busyMask(), 0U);
  for (const std::int32_t mask : {0x15, -2}) {
    EXPECT_EQ((updaters.call<&checkLASDUpdate>(server->servicePort(), std::tuple(mask))), kern::success);
  }
  EXPECT_EQ(
      log.entries(),
      (std::vector{
          RecordingLog::unifiedLine(LogLevel::info, "Trying to see if update available for mask 15"),
          RecordingLog::unifiedLine(LogLevel::info, "Trying to see if update available for mask fffffffe")}));
  EXPECT_EQ(server->busyMask(), 3U) << "the process stays until both are done";
  EXPECT_EQ(queues.serial.at(0)->pending(), 2U);
  updater->shutDown();
}

}  // namespace
}  // namespace brenvik
