// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/RoutineTable.h"

#include <gtest/gtest.h>

#include <array>
#include <cstring>

namespace brenvik {
namespace {

TEST(RequestTest, ItShowsTheMessageWhereItLiesAndItsTrailer) {
  alignas(8) std::array<std::byte, 32> bytes{};
  const MessageHeader header{kComplexBit | kReplyDisposition, 32, 7, 0x103, 0, 8683556};
  const std::uint32_t count = 2;
  std::memcpy(bytes.data(), &header, sizeof header);
  std::memcpy(bytes.data() + kDescriptorCountOffset, &count, sizeof count);
  bytes[29] = std::byte{0xAB};
  const MessageTrailer trailer{};
  const Request request(bytes.data(), 28, &trailer);

  EXPECT_EQ(request.size(), 28U) << "what it was told, not what the sender wrote";
  EXPECT_EQ(static_cast<const void*>(&request.header()), bytes.data());
  EXPECT_EQ(request.header().id, 8683556);
  EXPECT_EQ(request.localPort(), 0x103U);
  EXPECT_EQ(request.descriptorCount(), 2U);
  EXPECT_EQ(request.at<std::uint8_t>(29), 0xAB);
  EXPECT_EQ(static_cast<const void*>(&request.trailer()), &trailer);
  request.as<MessageHeader>().voucher = 5;
  EXPECT_EQ(request.header().voucher, 5U) << "routines write into the message itself";
}

TEST(RequestTest, OnlyTheComplexBitMakesItComplex) {
  MessageHeader header{};
  const MessageTrailer trailer{};
  const Request request(reinterpret_cast<std::byte*>(&header), sizeof header, &trailer);
  header.bits = ~kComplexBit;
  EXPECT_FALSE(request.isComplex());
  header.bits = kComplexBit;
  EXPECT_TRUE(request.isComplex());
}

TEST(ReplyTest, AStatusIsASimpleMessageOf36BytesWithTheCode) {
  alignas(8) std::array<std::byte, 64> bytes{};
  Reply reply(bytes.data());
  EXPECT_EQ(static_cast<void*>(&reply.header()), bytes.data());
  reply.header().bits = kComplexBit;
  reply.header().id = 9;
  reply.setStatus(kern::noAccess);
  const auto& status = reply.as<StatusReply>();
  EXPECT_EQ(status.header.bits, kReplyDisposition);
  EXPECT_EQ(status.header.size, 36U);
  EXPECT_EQ(status.header.id, 9);
  EXPECT_EQ(std::memcmp(&status.ndr, &kNdrRecord, sizeof kNdrRecord), 0);
  EXPECT_EQ(status.returnCode, kern::noAccess);
  EXPECT_EQ(bytes[sizeof(StatusReply)], std::byte{0}) << "nothing behind it is written";
}

}  // namespace
}  // namespace brenvik
