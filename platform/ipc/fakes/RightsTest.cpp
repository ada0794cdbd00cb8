// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/Rights.h"

#include <gtest/gtest.h>

#include <utility>

#include "platform/ipc/fakes/FakePorts.h"

namespace brenvik {
namespace {

class RightsTest : public testing::Test {
 protected:
  PortName allocate() {
    PortName name = kNullPort;
    EXPECT_EQ(ports.allocateReceiveRight(&name), kern::success);
    return name;
  }
  FakePortSpace ports;
};

TEST_F(RightsTest, AReceiveRightAndASendRightEachDropTheirOwnReferenceOnce) {
  const PortName name = allocate();
  ASSERT_EQ(ports.insertSendRight(name), kern::success);
  {
    const SendRight send(ports, name);
    {
      const ReceiveRight receive(ports, name);
      EXPECT_EQ(receive.name(), name);
    }
    EXPECT_TRUE(ports.receiveRights.empty());
    EXPECT_EQ(ports.sendRights.at(name), 1);
  }
  EXPECT_TRUE(ports.sendRights.empty());
  EXPECT_EQ(ports.failedDrops, 0);
}

TEST_F(RightsTest, AMovedRightIsDroppedByItsNewOwnerAlone) {
  ReceiveRight first(ports, allocate());
  ReceiveRight second(ports, allocate());
  const PortName kept = first.name();
  second = std::move(first);
  EXPECT_EQ(second.name(), kept);
  EXPECT_FALSE(first);  // NOLINT(bugprone-use-after-move): it is empty
  EXPECT_EQ(ports.receiveRights.size(), 1U) << "the one that stood there was dropped";
  const ReceiveRight third(std::move(second));
  EXPECT_EQ(third.name(), kept);
  EXPECT_EQ(ports.failedDrops, 0);
}

TEST_F(RightsTest, ARightThatIsMovedIntoAnEmptyOneOrOneOfAnotherSpaceIsDroppedInItsOwnSpace) {
  FakePortSpace others;
  PortName ofOthers = kNullPort;
  ASSERT_EQ(others.allocateReceiveRight(&ofOthers), kern::success);
  ReceiveRight empty;
  ReceiveRight right(others, ofOthers);
  empty = ReceiveRight(ports, allocate());
  right = ReceiveRight(ports, allocate());
  EXPECT_TRUE(others.receiveRights.empty());
  EXPECT_EQ(ports.receiveRights.size(), 2U);
  empty.reset();
  right.reset();
  EXPECT_FALSE(empty);
  EXPECT_EQ(right.name(), kNullPort);
  EXPECT_TRUE(ports.receiveRights.empty());
  right.reset();
  EXPECT_EQ(ports.failedDrops + others.failedDrops, 0);
}

TEST_F(RightsTest, AReleasedRightStaysAndAnEmptyOneOrADeadNameDropsNothing) {
  const PortName name = allocate();
  { EXPECT_EQ(ReceiveRight(ports, name).release(), name); }
  EXPECT_EQ(ports.receiveRights.at(name), 1);
  {
    const SendRight empty;
    const SendRight dead(ports, kDeadPort);
    EXPECT_FALSE(empty);
    EXPECT_FALSE(dead);
  }
  EXPECT_EQ(ports.failedDrops, 0);
}

}  // namespace
}  // namespace brenvik
