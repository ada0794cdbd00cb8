// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gtest/gtest.h>

#include <cerrno>
#include <limits>

#include "platform/network/EchoMessages.h"
#include "platform/network/ErrorNumbers.h"
#include "platform/network/GeoMessages.h"
#include "platform/network/GunzipMessages.h"
#include "platform/network/WebMessages.h"
#include "platform/worker/WorkerFields.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
using Bytes = std::vector<std::byte>;

// No shorter payload, and no longer one, is taken for the message.
template <typename Decode>
void expectNoOtherLength(const Bytes& payload, Decode decode) {
  ASSERT_TRUE(decode(payload));
  for (std::size_t size = 0; size < payload.size(); ++size)
    EXPECT_FALSE(decode(std::span(payload).first(size))) << size << " of " << payload.size();
  Bytes longer = payload;
  longer.push_back(std::byte{0});
  EXPECT_FALSE(decode(longer));
}

TEST(ErrorNumbersTest, WhatTheKernelMayUseIsAnErrorNumber) {
  for (const std::uint32_t number : {0U, 1U, 133U, 4095U}) EXPECT_TRUE(isErrorNumber(number)) << number;
  for (const std::uint32_t number : {4096U, 0x7FFFFFFFU, 0xFFFFFFFFU})
    EXPECT_FALSE(isErrorNumber(number)) << number;
}

TEST(WebMessagesTest, AQuestionArrivesAsItWasAsked) {
  const WebQuestion question{
      WebRequestType::get, "https://host/\u00fc", {{"A", "b"}, {"Empty", ""}}, false, 1500ms, 77};
  const auto payload = encode(question);
  const auto again = decodeWebQuestion(payload);
  ASSERT_TRUE(again);
  EXPECT_EQ(again->url, question.url);
  EXPECT_EQ(again->headers, question.headers);
  EXPECT_FALSE(again->cellularAllowed);
  EXPECT_EQ(again->timeLimit, 1500ms);
  EXPECT_EQ(again->largestBody, 77U);
  expectNoOtherLength(payload, decodeWebQuestion);
}

TEST(WebMessagesTest, AQuestionNobodyAsksIsNone) {
  WebQuestion question{WebRequestType::get, "https://host/", {}, true, 0ms, kLargestWebBody};
  EXPECT_TRUE(decodeWebQuestion(encode(question)));
  question.largestBody = kLargestWebBody + 1;
  EXPECT_FALSE(decodeWebQuestion(encode(question)));
  question.largestBody = 1;
  question.timeLimit = -1ms;
  EXPECT_FALSE(decodeWebQuestion(encode(question)));
  question.timeLimit = std::chrono::milliseconds(std::numeric_limits<std::int64_t>::max());
  EXPECT_FALSE(decodeWebQuestion(encode(question)));
  question.timeLimit = 0ms;
  question.headers = {{"A\r\nB", "c"}};
  EXPECT_FALSE(decodeWebQuestion(encode(question)));
  question.headers = {};
  question.type = static_cast<WebRequestType>(1);
  EXPECT_FALSE(decodeWebQuestion(encode(question)));
}

TEST(WebMessagesTest, AnAnswerArrivesAsItWasGiven) {
  const WebAnswer answer{
      WebErrorKind::none, 200, {{"Content-Type", "application/gzip"}, {"x", "a, b"}}, 1000};
  const auto payload = encode(answer);
  const auto decode = [](std::span<const std::byte> bytes) { return decodeWebAnswer(bytes, 1000); };
  const auto again = decode(payload);
  ASSERT_TRUE(again);
  EXPECT_EQ(again->errorKind, WebErrorKind::none);
  EXPECT_EQ(again->statusCode, 200);
  EXPECT_EQ(again->headers, answer.headers);
  EXPECT_EQ(again->bodySize, 1000U);
  expectNoOtherLength(payload, decode);
}

TEST(WebMessagesTest, AnAnswerThatCannotBeIsNone) {
  EXPECT_FALSE(decodeWebAnswer(encode(WebAnswer{WebErrorKind::none, 200, {}, 1001}), 1000))
      << "too large a body";
  EXPECT_FALSE(decodeWebAnswer(encode(WebAnswer{WebErrorKind::timedOut, 200, {}, 1}), 1000))
      << "a body of a failure";
  EXPECT_FALSE(decodeWebAnswer(encode(WebAnswer{WebErrorKind::none, 1000, {}, 0}), 1000)) << "no HTTP status";
  EXPECT_FALSE(decodeWebAnswer(encode(WebAnswer{WebErrorKind::none, -1, {}, 0}), 1000));
  EXPECT_FALSE(decodeWebAnswer(encode(WebAnswer{static_cast<WebErrorKind>(18), 0, {}, 0}), 1000))
      << "no such kind";
  EXPECT_FALSE(decodeWebAnswer(encode(WebAnswer{WebErrorKind::none, 200, {{"", "x"}}, 0}), 1000))
      << "no name";
  FieldWriter twice;
  twice.u32(1).u32(200).u64(0).u32(2).text("A").text("1").text("a").text("2");
  EXPECT_FALSE(decodeWebAnswer(twice.take(), 1000)) << "one name twice";
  FieldWriter endless;
  endless.u32(1).u32(200).u64(0).u32(0xFFFFFFFF).text("A").text("1");
  EXPECT_FALSE(decodeWebAnswer(endless.take(), 1000)) << "more fields than there are bytes";
}

TEST(GunzipMessagesTest, QuestionAndOutcomeArriveAsTheyWere) {
  const GunzipQuestion question{11, 22, 33};
  const auto asked = decodeGunzipQuestion(encode(question));
  ASSERT_TRUE(asked);
  EXPECT_EQ(asked->inputSize, 11U);
  EXPECT_EQ(asked->room, 22U);
  EXPECT_EQ(asked->largestOutput, 33U);
  expectNoOtherLength(encode(question), decodeGunzipQuestion);
  const auto decode = [&](std::span<const std::byte> bytes) { return decodeGunzipOutcome(bytes, question); };
  for (const GunzipOutcome& outcome : {GunzipOutcome{GunzipResult::whole, 33, 0},
                                       {GunzipResult::refused, 5, ENOSPC},
                                       {GunzipResult::damaged, 0, 0}}) {
    const auto told = decode(encode(outcome));
    ASSERT_TRUE(told);
    EXPECT_EQ(told->result, outcome.result);
    EXPECT_EQ(told->size, outcome.size);
    EXPECT_EQ(told->writeError, outcome.writeError);
    expectNoOtherLength(encode(outcome), decode);
  }
  for (const GunzipOutcome& lie : {GunzipOutcome{GunzipResult::whole, 34, 0},
                                   {GunzipResult::whole, 1, ENOSPC},
                                   {GunzipResult::refused, 1, 0},
                                   {GunzipResult::refused, 1, -1},
                                   {static_cast<GunzipResult>(7), 1, 0}}) {
    EXPECT_FALSE(decode(encode(lie)));
  }
  EXPECT_FALSE(decodeGunzipQuestion(encode(GunzipQuestion{1, 34, 33}))) << "more room than output";
}

StructuredAddress addressIn(const std::optional<GeoOutcome<MapItems>>& outcome) {
  if (!outcome || !outcome->answer || outcome->answer->size() != 1) return {};
  return outcome->answer->at(0)->address->structuredAddress.value();
}
GeoOutcome<MapItems> place(StructuredAddress address) {
  return {MapItems{MapItem{true, GeoAddress{std::move(address)}}}, std::nullopt};
}

TEST(GeoMessagesTest, PlacesArriveAsTheyWere) {
  const StructuredAddress all{"NO", "\u00d8stlandet", "Oslo by", "0150"};
  const auto told = addressIn(decodeMapItems(encode(place(all))));
  EXPECT_EQ(told.countryCode, all.countryCode);
  EXPECT_EQ(told.administrativeArea, all.administrativeArea);
  EXPECT_EQ(told.locality, all.locality);
  EXPECT_EQ(told.postCode, all.postCode);
  EXPECT_EQ(addressIn(decodeMapItems(encode(place({.locality = "C"})))).countryCode, std::nullopt);
  expectNoOtherLength(encode(place(all)), decodeMapItems);
  const auto nothing = decodeMapItems(encode(GeoOutcome<MapItems>{MapItems{}, std::nullopt}));
  ASSERT_TRUE(nothing);
  EXPECT_TRUE(nothing->answer->empty());
  EXPECT_FALSE(nothing->error);
  const auto bare = decodeMapItems(encode(GeoOutcome<MapItems>{
      MapItems{std::nullopt, MapItem{false, std::nullopt}, MapItem{true, GeoAddress{}}}, {}}));
  ASSERT_TRUE(bare);
  ASSERT_EQ(bare->answer->size(), 3U);
  EXPECT_FALSE(bare->answer->at(0));
  EXPECT_FALSE(bare->answer->at(1)->valid);
  EXPECT_FALSE(bare->answer->at(2)->address->structuredAddress);
}

TEST(GeoMessagesTest, ErrorsArriveAsTheyWereAndAreCutBetweenCharacters) {
  const auto told = decodeMapItems(encode(GeoOutcome<MapItems>{std::nullopt, GeoError{"no route"}}));
  ASSERT_TRUE(told);
  EXPECT_FALSE(told->answer);
  EXPECT_EQ(told->error->description, "no route");
  std::string description = "x";
  while (description.size() < 2000) description += "\u00fc";
  const auto cut = decodeGeoIpResult(encode(GeoOutcome<GeoIpResult>{std::nullopt, GeoError{description}}));
  ASSERT_TRUE(cut);
  EXPECT_EQ(cut->error->description, description.substr(0, 999));
  EXPECT_TRUE(decodeMapItems(encode(GeoOutcome<MapItems>{std::nullopt, GeoError{""}})))
      << "some line is there";
}

TEST(GeoMessagesTest, TextsInTheWrongPlaceAreRefused) {
  for (const std::string& code : std::vector<std::string>{"no", "NOR", "N", "", "N\n", std::string("N\0", 2)})
    EXPECT_FALSE(decodeMapItems(encode(place({.countryCode = code})))) << code;
  for (const std::string& text : {std::string(), std::string("a\0b", 3), std::string("\xff")})
    EXPECT_FALSE(decodeMapItems(encode(place({.locality = text}))));
  EXPECT_FALSE(decodeMapItems(encode(place({.locality = std::string(kLongestAddress, 'x')}))));
  for (const std::string ip : {"", "host", "1.2.3", "1.2.3.4\n", "1.2.3.4 ", "::1%eth0"})
    EXPECT_FALSE(decodeGeoIpResult(encode(GeoOutcome<GeoIpResult>{GeoIpResult{ip}, std::nullopt}))) << ip;
  for (const std::string ip : {"203.0.113.7", "2001:db8::1"}) {
    const auto told = decodeGeoIpResult(encode(GeoOutcome<GeoIpResult>{GeoIpResult{ip}, std::nullopt}));
    ASSERT_TRUE(told);
    EXPECT_EQ(told->answer->ipAddress, ip);
  }
}

TEST(EchoMessagesTest, QuestionsAndAnswersArriveAsTheyWere) {
  EXPECT_EQ(decodeName(encodeName("icmp")), "icmp");
  EXPECT_FALSE(decodeName(encodeName(std::string(256, 'x').c_str())));
  EXPECT_EQ(decodeNumber(encodeNumber(7)).value(), 7U);
  EXPECT_EQ(decodeNumber(encodeNumber(std::nullopt)).value(), std::nullopt);
  expectNoOtherLength(encodeNumber(7), decodeNumber);
  const auto socket = decodeSocket(encodeSocket(1, 0xBEEF));
  ASSERT_TRUE(socket);
  EXPECT_EQ(socket->protocol, 1);
  EXPECT_EQ(socket->identifier, 0xBEEF);
  EXPECT_FALSE(decodeSocket(encodeSocket(256, 1)));
  EXPECT_FALSE(decodeSocket(FieldWriter().u32(1).u32(65536).take()));
  EXPECT_EQ(decodeForm(encode(EchoSocketForm::withIpHeader)), EchoSocketForm::withIpHeader);
  EXPECT_FALSE(decodeForm(FieldWriter().u8(3).take()));
  const Bytes message(48, std::byte{8});
  const auto sendPayload = encodeSend({0x01020304}, message);
  const auto send = decodeSend(sendPayload);
  ASSERT_TRUE(send);
  EXPECT_EQ(send->destination.s_addr, 0x01020304U);
  EXPECT_TRUE(std::equal(send->message.begin(), send->message.end(), message.begin(), message.end()));
  EXPECT_FALSE(decodeSend(encodeSend({0}, Bytes(kLongestEcho + 1))));
}

TEST(EchoMessagesTest, ATransferThatCannotBeIsRefused) {
  const Bytes bytes(48, std::byte{1});
  const auto told = decodeTransfer(encodeTransfer({48, 0}, bytes), 48);
  ASSERT_TRUE(told);
  EXPECT_EQ(told->transfer.count, 48);
  EXPECT_EQ(told->bytes, bytes);
  EXPECT_EQ(decodeTransfer(encodeTransfer({-1, EAGAIN}, {}), 48)->transfer.error, EAGAIN);
  EXPECT_FALSE(decodeTransfer(encodeTransfer({48, 0}, bytes), 47)) << "more than was asked for";
  EXPECT_FALSE(decodeTransfer(encodeTransfer({47, 0}, bytes), 48)) << "another count than there are bytes";
  EXPECT_FALSE(decodeTransfer(encodeTransfer({-2, 0}, {}), 48));
  EXPECT_FALSE(decodeTransfer(encodeTransfer({-1, -5}, {}), 48)) << "no error number";
}

}  // namespace
}  // namespace brenvik
