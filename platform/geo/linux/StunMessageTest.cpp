// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/StunMessage.h"

#include <gtest/gtest.h>

#include <vector>

namespace brenvik {
namespace {

using Bytes = std::vector<std::byte>;

Bytes hex(const char* text) {
  Bytes bytes;
  unsigned value = 0;
  int digits = 0;
  for (; *text != 0; ++text) {
    if (*text == ' ') continue;
    value = value * 16 + static_cast<unsigned>(*text <= '9' ? *text - '0' : *text - 'a' + 10);
    if (++digits % 2 == 0) bytes.push_back(static_cast<std::byte>(std::exchange(value, 0)));
  }
  return bytes;
}

StunTransactionId idOf(const Bytes& message) {
  StunTransactionId id{};
  std::copy_n(message.begin() + 8, id.size(), id.begin());
  return id;
}

// The sample answers of RFC 5769, 2.2 and 2.3.
const Bytes kIpv4Answer =
    hex("0101003c2112a442b7e7a701bc34d686fa87dfae"
        "8022000b7465737420766563746f7220"
        "002000080001a147e112a643"
        "000800142b91f599fd9e90c38c7489f92af9ba53f06be7d7"
        "80280004c07d4c96");
const Bytes kIpv6Answer =
    hex("010100482112a442b7e7a701bc34d686fa87dfae"
        "8022000b7465737420766563746f7220"
        "002000140002a1470113a9faa5d3f179bc25f4b5bed2b9d9"
        "00080014a382954e4be67bf11784c97c8292c275bfe3ed41"
        "80280004c8fb0b4c");

// An answer with these attributes after the header.
Bytes answerWith(const Bytes& attributes, const char* type = "0101") {
  Bytes message = hex(type);
  message.push_back(static_cast<std::byte>(attributes.size() >> 8));
  message.push_back(static_cast<std::byte>(attributes.size() & 255));
  const Bytes rest = hex("2112a442000102030405060708090a0b");
  message.insert(message.end(), rest.begin(), rest.end());
  message.insert(message.end(), attributes.begin(), attributes.end());
  return message;
}
StunAnswer read(const Bytes& message) { return readStunAnswer(message, idOf(message)); }

TEST(StunMessageTest, ARequestIsTwentyBytes) {
  StunTransactionId id{};
  for (std::size_t i = 0; i < id.size(); ++i) id[i] = static_cast<std::byte>(i);
  const auto request = makeStunBindingRequest(id);
  EXPECT_EQ(Bytes(request.begin(), request.end()), hex("000100002112a442000102030405060708090a0b"));
}

TEST(StunMessageTest, ReadsTheSampleAnswers) {
  EXPECT_EQ(read(kIpv4Answer).verdict, StunVerdict::address);
  EXPECT_EQ(read(kIpv4Answer).address, "192.0.2.1");
  EXPECT_EQ(read(kIpv6Answer).verdict, StunVerdict::address);
  EXPECT_EQ(read(kIpv6Answer).address, "2001:db8:1234:5678:11:2233:4455:6677");
}

TEST(StunMessageTest, EveryShorterOrLongerAnswerIsIgnored) {
  for (const Bytes& answer : {kIpv4Answer, kIpv6Answer}) {
    for (std::size_t size = 0; size < answer.size(); ++size) {
      const Bytes cut(answer.begin(), answer.begin() + static_cast<std::ptrdiff_t>(size));
      EXPECT_EQ(readStunAnswer(cut, idOf(answer)).verdict, StunVerdict::ignored) << size;
    }
    for (std::size_t more = 1; more <= 8; ++more) {
      Bytes longer = answer;
      longer.resize(answer.size() + more);
      EXPECT_EQ(readStunAnswer(longer, idOf(answer)).verdict, StunVerdict::ignored) << more;
    }
  }
}

TEST(StunMessageTest, EveryFlippedBitOfTheHeaderIsIgnored) {
  for (std::size_t bit = 0; bit < 20 * 8; ++bit) {
    Bytes answer = kIpv4Answer;
    answer[bit / 8] ^= static_cast<std::byte>(1U << (bit % 8));
    const auto verdict = readStunAnswer(answer, idOf(kIpv4Answer)).verdict;
    // One bit away from success is the type of an error response, which is an answer too.
    const bool errorResponse = answer[0] == std::byte{1} && answer[1] == std::byte{0x11};
    EXPECT_EQ(verdict, errorResponse ? StunVerdict::refused : StunVerdict::ignored) << bit;
  }
}

TEST(StunMessageTest, AnotherRequestsAnswerIsIgnored) {
  StunTransactionId other = idOf(kIpv4Answer);
  other[11] ^= std::byte{1};
  EXPECT_EQ(readStunAnswer(kIpv4Answer, other).verdict, StunVerdict::ignored);
}

TEST(StunMessageTest, AnErrorResponseIsARefusal) {
  EXPECT_EQ(read(answerWith(hex("00090010 00000401 556e617574686f72697a6564"), "0111")).verdict,
            StunVerdict::refused);
  EXPECT_EQ(read(answerWith({}, "0111")).verdict, StunVerdict::refused);
}

TEST(StunMessageTest, ASuccessWithoutAddressIsAnAnswerWithoutOne) {
  EXPECT_EQ(read(answerWith({})).verdict, StunVerdict::noAddress);
  EXPECT_EQ(read(answerWith(hex("000100080001a147c0000201"))).verdict, StunVerdict::noAddress);
}

TEST(StunMessageTest, AnUnknownAttributeThatMustBeUnderstoodMakesTheAnswerIgnored) {
  const std::string address = "002000080001a147e112a643";
  for (const char* attribute : {"00000000", "000c0000", "00130000", "00160004deadbeef", "001b0000",
                                "001f0000", "00210000", "00240000", "7fff0000"}) {
    EXPECT_EQ(read(answerWith(hex((attribute + address).c_str()))).verdict, StunVerdict::ignored)
        << attribute;
    EXPECT_EQ(read(answerWith(hex((address + attribute).c_str()))).verdict, StunVerdict::ignored)
        << attribute;
    EXPECT_EQ(read(answerWith(hex(attribute))).verdict, StunVerdict::ignored) << attribute;
  }
  for (const char* attribute : {"80000000", "8022000474657374", "ffff0000", "0004000800010d96c0000201",
                                "0005000800010d96c0000201", "001500016e000000"}) {
    EXPECT_EQ(read(answerWith(hex((attribute + address).c_str()))).address, "192.0.2.1") << attribute;
  }
}

TEST(StunMessageTest, TheFirstOfTwoAddressesCounts) {
  EXPECT_EQ(read(answerWith(hex("002000080001a147e112a643 002000080001a147e112a644"))).address, "192.0.2.1");
  EXPECT_EQ(read(answerWith(hex("002000080007a147e112a643 002000080001a147e112a644"))).verdict,
            StunVerdict::noAddress);
}

TEST(StunMessageTest, AnAddressOfTheWrongLengthOrFamilyIsNone) {
  for (const char* attribute :
       {"00200000", "002000040001a147", "002000140001a1470113a9faa5d3f179bc25f4b5bed2b9d9",
        "002000080002a147e112a643", "002000080000a147e112a643", "002000080003a147e112a643",
        "002000070001a147e112a643", "00200003000100ff"}) {
    EXPECT_EQ(read(answerWith(hex(attribute))).verdict, StunVerdict::noAddress) << attribute;
  }
}

TEST(StunMessageTest, AnAttributeLongerThanTheMessageIsIgnored) {
  EXPECT_EQ(read(answerWith(hex("002000080001a147e112a643 80220005"))).verdict, StunVerdict::ignored);
  EXPECT_EQ(read(answerWith(hex("8022ffff 002000080001a147e112a643"))).verdict, StunVerdict::ignored);
}

TEST(StunMessageTest, AnAddressThatNoHostCanHaveIsNone) {
  // 0.0.0.0, 0.1.2.3, 224.0.0.1, 240.0.0.1, 255.255.255.255, each xor'ed with the cookie.
  for (const char* attribute :
       {"002000080001a1472112a442", "002000080001a1472113a641", "002000080001a147c112a443",
        "002000080001a147d112a443", "002000080001a147deed5bbd"}) {
    EXPECT_EQ(read(answerWith(hex(attribute))).verdict, StunVerdict::noAddress) << attribute;
  }
  // :: and ff02::1
  for (const char* attribute : {"002000140002a1472112a442000102030405060708090a0b",
                                "002000140002a147de10a442000102030405060708090a0a"}) {
    EXPECT_EQ(read(answerWith(hex(attribute))).verdict, StunVerdict::noAddress) << attribute;
  }
}

TEST(StunMessageTest, ALoopbackAddressIsWhatAServerOnThisHostSees) {
  EXPECT_EQ(read(answerWith(hex("002000080001a1475e12a443"))).address, "127.0.0.1");
}

}  // namespace
}  // namespace brenvik
