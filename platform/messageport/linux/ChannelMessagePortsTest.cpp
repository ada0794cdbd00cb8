// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/messageport/linux/ChannelMessagePorts.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>
#include <filesystem>
#include <string_view>
#include <vector>

#include "interface/Wire.h"
#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

constexpr const char kName[] = "com.norvale.test.port";

std::span<const std::byte> bytesOf(std::string_view text) {
  return {reinterpret_cast<const std::byte*>(text.data()), text.size()};
}

class ChannelMessagePortsTest : public testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = testing::TempDir() + "messageportXXXXXX";
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    folder = pattern;
  }
  void TearDown() override { std::filesystem::remove_all(folder); }

  void listen(int backlog) {
    listener.reset(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = folder / kName;
    ASSERT_LT(path.size(), sizeof address.sun_path);
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    ASSERT_EQ(::bind(listener.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(::listen(listener.get(), backlog), 0);
  }
  // The next datagram of the next connection.
  std::vector<std::byte> receive() {
    const UniqueFd connection(::accept(listener.get(), nullptr, nullptr));
    EXPECT_TRUE(connection.isValid());
    std::vector<std::byte> datagram(kLargestDatagram + 1);
    const auto size = ::recv(connection.get(), datagram.data(), datagram.size(), MSG_DONTWAIT);
    EXPECT_GE(size, 0);
    datagram.resize(size < 0 ? 0 : static_cast<std::size_t>(size));
    return datagram;
  }

  std::filesystem::path folder;
  UniqueFd listener;
};

TEST_F(ChannelMessagePortsTest, AMessageIsAHeaderWithoutReplyPortAndThenTheData) {
  listen(8);
  ChannelMessagePorts ports(folder);
  {
    const auto port = ports.openRemote(kName);
    ASSERT_NE(port, nullptr);
    EXPECT_TRUE(port->send(-7, bytesOf("some data")));
  }
  const auto datagram = receive();  // the sender is gone; its message is not
  ASSERT_EQ(datagram.size(), 24U + 9);
  MessageHeader header{};
  std::memcpy(&header, datagram.data(), sizeof header);
  EXPECT_EQ(header.bits, 0U);
  EXPECT_EQ(header.size, 33U);
  EXPECT_EQ(header.replyPort, 0U);
  EXPECT_EQ(header.localPort, 0U);
  EXPECT_EQ(header.voucher, 0U);
  EXPECT_EQ(header.id, -7);
  EXPECT_EQ(std::memcmp(datagram.data() + 24, "some data", 9), 0);
}

TEST_F(ChannelMessagePortsTest, WhereNobodyListensThereIsNoPort) {
  ChannelMessagePorts ports(folder);
  EXPECT_EQ(ports.openRemote(kName), nullptr) << "no socket file";
  listen(8);
  listener.reset();
  EXPECT_EQ(ports.openRemote(kName), nullptr) << "a socket file left behind";
}

TEST_F(ChannelMessagePortsTest, ABusyListenerDropsTheMessageAndNobodyWaits) {
  listen(0);
  ChannelMessagePorts ports(folder);
  std::vector<std::unique_ptr<RemoteMessagePort>> open;
  for (int i = 0; i < 4; ++i) open.push_back(ports.openRemote(kName));
  EXPECT_NE(open.front(), nullptr);
  EXPECT_EQ(open.back(), nullptr);
}

TEST_F(ChannelMessagePortsTest, AFullOrClosedChannelDropsTheMessageAndRaisesNoSignal) {
  listen(8);
  ChannelMessagePorts ports(folder);
  const auto port = ports.openRemote(kName);
  ASSERT_NE(port, nullptr);
  const std::string big(60'000, 'x');
  int sent = 0;
  while (port->send(0, bytesOf(big))) ASSERT_LT(++sent, 10'000);
  EXPECT_GT(sent, 0);
  { const UniqueFd connection(::accept(listener.get(), nullptr, nullptr)); }
  EXPECT_FALSE(port->send(0, bytesOf("gone")));
}

TEST_F(ChannelMessagePortsTest, AMessageThatNoDatagramHoldsIsDropped) {
  listen(8);
  ChannelMessagePorts ports(folder);
  const auto port = ports.openRemote(kName);
  ASSERT_NE(port, nullptr);
  EXPECT_FALSE(port->send(0, std::vector<std::byte>(kLargestDatagram - 24 + 1)));
  EXPECT_TRUE(port->send(0, std::vector<std::byte>(kLargestDatagram - 24)));
  EXPECT_EQ(receive().size(), kLargestDatagram);
}

TEST_F(ChannelMessagePortsTest, ANameTooLongForASocketAddressNamesNothing) {
  ChannelMessagePorts ports(folder);
  EXPECT_EQ(ports.openRemote(std::string(108, 'n')), nullptr);
}

}  // namespace
}  // namespace brenvik
