// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/heartbeat/EchoMessage.h"

#include <gtest/gtest.h>

#include <cstring>
#include <vector>

namespace brenvik {
namespace {

std::vector<std::byte> bytesOf(std::initializer_list<int> values) {
  std::vector<std::byte> bytes;
  for (const int value : values) bytes.push_back(static_cast<std::byte>(value));
  return bytes;
}

std::vector<std::byte> replyWith(std::uint16_t identifier, std::size_t size = kEchoMessageSize) {
  const EchoMessage request = makeEchoRequest(identifier, timeval{});
  std::vector<std::byte> reply(request.begin(), request.end());
  reply[0] = std::byte{0};
  reply.resize(size);
  return reply;
}

std::vector<std::byte> afterHeader(std::size_t headerSize, const std::vector<std::byte>& message) {
  std::vector<std::byte> datagram(headerSize);
  datagram[0] = static_cast<std::byte>(0x40 | (headerSize / 4));
  datagram.insert(datagram.end(), message.begin(), message.end());
  return datagram;
}

TEST(EchoMessageTest, ChecksumIsThatOfTheStandardsExample) {
  // RFC 1071, section 3: the words 0001 f203 f4f5 f6f7 sum to ddf2.
  EXPECT_EQ(internetChecksum(bytesOf({0x00, 0x01, 0xf2, 0x03, 0xf4, 0xf5, 0xf6, 0xf7})), 0xFFFF ^ 0xDDF2);
  EXPECT_EQ(internetChecksum({}), 0xFFFF);
  EXPECT_EQ(internetChecksum(bytesOf({0x12})), 0xFFFF ^ 0x1200);
  EXPECT_EQ(internetChecksum(bytesOf({0xFF, 0xFF, 0xFF, 0xFF})), 0);
}

TEST(EchoMessageTest, ARequestIsAsDescribedByteByByte) {
  const timeval time{0x0102030405060708, 0x0A0B0C};
  const EchoMessage message = makeEchoRequest(0xBEEF, time);
  ASSERT_EQ(message.size(), 48U);
  EXPECT_EQ(message[0], std::byte{8});
  EXPECT_EQ(message[1], std::byte{0});
  EXPECT_EQ(message[4], std::byte{0xBE});
  EXPECT_EQ(message[5], std::byte{0xEF});
  EXPECT_EQ(message[6], std::byte{0});
  EXPECT_EQ(message[7], std::byte{0});
  timeval stamped{};
  std::memcpy(&stamped, message.data() + 8, sizeof stamped);
  EXPECT_EQ(stamped.tv_sec, time.tv_sec);
  EXPECT_EQ(stamped.tv_usec, time.tv_usec);
  for (std::size_t i = 24; i < message.size(); ++i) EXPECT_EQ(message[i], std::byte{0}) << i;
  EXPECT_EQ(internetChecksum(message), 0)
      << "over a whole message, its checksum included, the sum is complete";
  EchoMessage without = message;
  without[2] = without[3] = std::byte{0};
  const std::uint16_t checksum = internetChecksum(without);
  EXPECT_EQ(message[2], static_cast<std::byte>(checksum >> 8));
  EXPECT_EQ(message[3], static_cast<std::byte>(checksum & 0xFF));
}

TEST(EchoMessageTest, AReplyToOurIdentifierMatchesWithAndWithoutIpHeader) {
  EXPECT_TRUE(isEchoReply(replyWith(0x1234), false, 0x1234));
  EXPECT_TRUE(isEchoReply(replyWith(0x1234, 2048), false, 0x1234));
  for (std::size_t headerSize = 4; headerSize <= 60; headerSize += 4) {
    EXPECT_TRUE(isEchoReply(afterHeader(headerSize, replyWith(0x1234)), true, 0x1234)) << headerSize;
  }
}

TEST(EchoMessageTest, EchoRepliesForOtherProcessesDoNotMatch) {
  EXPECT_FALSE(isEchoReply(replyWith(0x1234), false, 0x1235));
  EXPECT_FALSE(isEchoReply(replyWith(0x3412), false, 0x1234));
  EXPECT_FALSE(isEchoReply(afterHeader(20, replyWith(0x0034)), true, 0x1234));
}

TEST(EchoMessageTest, AReplyShorterThan48BytesAfterTheIpHeaderDoesNotMatch) {
  for (std::size_t size = 0; size < kEchoMessageSize; ++size) {
    EXPECT_FALSE(isEchoReply(replyWith(7, size), false, 7)) << size;
    EXPECT_FALSE(isEchoReply(afterHeader(20, replyWith(7, size)), true, 7)) << size;
  }
}

TEST(EchoMessageTest, OtherTypesDoNotMatch) {
  for (int type = 1; type < 256; ++type) {
    auto message = replyWith(7);
    message[0] = static_cast<std::byte>(type);
    EXPECT_FALSE(isEchoReply(message, false, 7)) << type;
  }
}

TEST(EchoMessageTest, AHeaderLongerThanTheDatagramDoesNotMatch) {
  for (std::size_t size = 0; size < 60; ++size) {
    std::vector<std::byte> datagram(size, std::byte{0});
    if (size > 0) datagram[0] = std::byte{0x4F};
    EXPECT_FALSE(isEchoReply(datagram, true, 0)) << size;
  }
}

}  // namespace
}  // namespace brenvik
