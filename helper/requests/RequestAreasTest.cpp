// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/requests/RequestAreas.h"

#include <gtest/gtest.h>

#include <string>

#include "platform/ipc/fakes/FakePorts.h"
#include "platform/runloop/fakes/ManualRunLoop.h"

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
  PortServerRegistry registry;
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

TEST_F(RequestAreasTest, ARoutineThatTakesAServerGetsTheOneOfThePortAndWithoutOneFails) {
  const std::tuple<std::int32_t> arguments{-5};
  EXPECT_EQ(areas.call<&withServer>(kPort, arguments), kern::failure);
  EXPECT_EQ(numbers.server, nullptr);

  ManualClock clock;
  ManualRunLoop loop{clock};
  FakePortSpace ports;
  FakeBootstrap bootstrap{ports};
  FakePortSources sources;
  NoRoutines routines;
  const ServerPlatform platform{
      ports, bootstrap, sources, loop, [](const char*, const AuditToken&) { return true; }, registry};
  const auto server = CreateServer(platform, "service", routines);
  EXPECT_EQ(areas.call<&withServer>(server->servicePort(), arguments), 23);
  EXPECT_EQ(numbers.server, server.get());
  EXPECT_EQ(numbers.value, -5);
}

}  // namespace
}  // namespace brenvik
