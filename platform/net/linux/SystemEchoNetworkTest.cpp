// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/net/linux/SystemEchoNetwork.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <linux/if_ether.h>

#include <array>
#include <cerrno>
#include <vector>

#include "platform/net/fakes/PrivateNetwork.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

constexpr std::uint16_t kIdentifier = 0x4321;

// An echo request of 48 bytes with its checksum, the rest of it zero.
std::vector<std::byte> request(std::uint16_t identifier) {
  std::vector<std::byte> message(48);
  message[0] = std::byte{8};
  message[4] = static_cast<std::byte>(identifier >> 8);
  message[5] = static_cast<std::byte>(identifier & 0xFF);
  const unsigned checksum = 0xFFFFU ^ (0x0800U + identifier);
  message[2] = static_cast<std::byte>(checksum >> 8);
  message[3] = static_cast<std::byte>(checksum & 0xFF);
  return message;
}

// Our end has pdp_ip0, 10.9.0.1, and the far end, a namespace of its own, far0 with 10.9.0.2.
class SystemEchoNetworkTest : public testing::Test {
 protected:
  void SetUp() override {
    if (!ours.isMade() || !theirs.isMade()) GTEST_SKIP() << "no permission to make a network namespace";
    ASSERT_TRUE(ours.ip("link set lo up"));
    ASSERT_TRUE(ours.ip("link add pdp_ip0 type veth peer name far0 netns " + theirs.name()));
    ASSERT_TRUE(ours.ip("address add 10.9.0.1/24 dev pdp_ip0"));
    ASSERT_TRUE(ours.ip("link set pdp_ip0 up"));
    ASSERT_TRUE(theirs.ip("address add 10.9.0.2/24 dev far0"));
    ASSERT_TRUE(theirs.ip("link set far0 up"));
    ASSERT_TRUE(ours.waitUntilUp("pdp_ip0") && theirs.waitUntilUp("far0"));
  }
  void openDatagramSockets(bool open) {
    ASSERT_TRUE(ours.set("net/ipv4/ping_group_range", open ? "0 2147483647" : "1 0"));
  }
  // Sends a request and returns what comes back, after the IP header if there is one.
  std::vector<std::byte> exchange(EchoSocket& socket, const char* address) {
    EXPECT_EQ(socket.setReceiveTimeOut(20s), 0);
    const auto sent = socket.sendTo(in_addr{::inet_addr(address)}, request(kIdentifier));
    EXPECT_EQ(sent.count, 48) << sent.error;
    std::array<std::byte, 2048> buffer;
    for (;;) {
      const auto received = socket.receive(buffer);
      if (received.count < 0) {
        EXPECT_EQ(received.error, EAGAIN);
        return {};
      }
      const std::size_t skip =
          socket.deliversIpHeader() ? (std::to_integer<std::size_t>(buffer[0]) & 0x0F) * 4 : 0;
      // A raw socket also sees our own request pass by on the loopback interface.
      if (buffer[skip] == std::byte{0}) return {buffer.begin() + skip, buffer.begin() + received.count};
    }
  }
  void expectReply(const std::vector<std::byte>& reply) {
    auto expected = request(kIdentifier);
    ASSERT_EQ(reply.size(), expected.size());
    EXPECT_EQ(reply[0], std::byte{0});
    EXPECT_EQ(reply[4], expected[4]);
    EXPECT_EQ(reply[5], expected[5]);
  }

  PrivateNetwork ours;
  PrivateNetwork theirs;
  SystemEchoNetwork network;
};

TEST_F(SystemEchoNetworkTest, ADatagramSocketKeepsTheIdentifierWhereTheGroupRangeIsOpen) {
  openDatagramSockets(true);
  ours.run([&] {
    const auto socket = network.openEchoSocket(IPPROTO_ICMP, kIdentifier);
    ASSERT_NE(socket, nullptr);
    EXPECT_FALSE(socket->deliversIpHeader());
    expectReply(exchange(*socket, "10.9.0.2"));
  });
}

TEST_F(SystemEchoNetworkTest, ARawSocketTakesOverWhereTheGroupRangeIsClosed) {
  openDatagramSockets(false);
  ours.run([&] {
    const auto socket = network.openEchoSocket(IPPROTO_ICMP, kIdentifier);
    ASSERT_NE(socket, nullptr);
    EXPECT_TRUE(socket->deliversIpHeader());
    expectReply(exchange(*socket, "10.9.0.2"));
  });
}

TEST_F(SystemEchoNetworkTest, ARawSocketTakesOverForIdentifier0WhichADatagramSocketCannotKeep) {
  openDatagramSockets(true);
  ours.run([&] {
    const auto socket = network.openEchoSocket(IPPROTO_ICMP, 0);
    ASSERT_NE(socket, nullptr);
    EXPECT_TRUE(socket->deliversIpHeader());
  });
}

TEST_F(SystemEchoNetworkTest, ABoundSocketSendsByItsInterfaceWhateverTheRoute) {
  for (const bool datagram : {true, false}) {
    openDatagramSockets(datagram);
    ours.run([&] {
      const auto socket = network.openEchoSocket(IPPROTO_ICMP, kIdentifier);
      ASSERT_NE(socket, nullptr);
      const auto sent = socket->sendTo(in_addr{::inet_addr("203.0.113.9")}, request(kIdentifier));
      EXPECT_EQ(sent.count, -1);
      EXPECT_EQ(sent.error, ENETUNREACH) << "no route";
      const unsigned index = network.indexOfInterface("pdp_ip0");
      ASSERT_NE(index, 0U);
      socket->bindToInterface(index);
      EXPECT_EQ(socket->sendTo(in_addr{::inet_addr("203.0.113.9")}, request(kIdentifier)).count, 48);
    });
  }
}

TEST_F(SystemEchoNetworkTest, WhatGoesOutIsTheMessageByteForByte) {
  for (const bool datagram : {true, false}) {
    openDatagramSockets(datagram);
    std::unique_ptr<PacketTap> tap;
    theirs.run([&] { tap = std::make_unique<PacketTap>("far0"); });
    ASSERT_TRUE(tap->isMade());
    ours.run([&] {
      const auto socket = network.openEchoSocket(IPPROTO_ICMP, kIdentifier);
      ASSERT_NE(socket, nullptr);
      expectReply(exchange(*socket, "10.9.0.2"));
    });
    std::vector<std::vector<std::uint8_t>> icmp;
    for (const auto& packet : tap->packets(1, 2s)) {
      if (packet.protocol == ETH_P_IP && packet.bytes.size() > 9 && packet.bytes[9] == IPPROTO_ICMP) {
        icmp.push_back(packet.bytes);
      }
    }
    ASSERT_EQ(icmp.size(), 1U);
    const auto expected = request(kIdentifier);
    ASSERT_EQ(icmp[0].size(), 20 + expected.size());
    for (std::size_t i = 0; i < expected.size(); ++i) {
      EXPECT_EQ(icmp[0][20 + i], std::to_integer<std::uint8_t>(expected[i])) << "byte " << i;
    }
  }
}

TEST_F(SystemEchoNetworkTest, SilenceEndsWithTheReceiveTimeOut) {
  openDatagramSockets(false);
  ours.run([&] {
    const auto socket = network.openEchoSocket(IPPROTO_ICMP, kIdentifier);
    ASSERT_NE(socket, nullptr);
    ASSERT_EQ(socket->setReceiveTimeOut(20ms), 0);
    std::array<std::byte, 64> buffer;
    const auto before = network.steadyTime();
    const auto received = socket->receive(buffer);
    EXPECT_EQ(received.count, -1);
    EXPECT_EQ(received.error, EAGAIN);
    EXPECT_GE(network.steadyTime() - before, 20ms);
  });
}

TEST_F(SystemEchoNetworkTest, NamesAreFoundOrNot) {
  EXPECT_EQ(network.protocolByName("icmp"), 1);
  EXPECT_FALSE(network.protocolByName("no such protocol").has_value());
  const auto local = network.addressOfHost("localhost");
  ASSERT_TRUE(local.has_value());
  EXPECT_EQ(local->s_addr, htonl(INADDR_LOOPBACK));
  ours.run([&] { EXPECT_EQ(network.indexOfInterface("wlan9"), 0U); });
  timeval now{};
  EXPECT_EQ(network.timeOfDay(&now), 0);
  EXPECT_GT(now.tv_sec, 1'600'000'000);
}

}  // namespace
}  // namespace brenvik
