// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/ReverseGeocoder.h"

#include <gtest/gtest.h>

#include <limits>

#include "platform/geo/linux/GeocoderAnswer.h"
#include "platform/log/LogContext.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/runloop/fakes/ManualRunLoop.h"
#include "platform/web/fakes/ScriptedWebClient.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

constexpr const char* kServer = "https://geo.example.test/nominatim";
constexpr Coordinate kOslo{59.9133, 10.739};
constexpr const char* kOsloUrl =
    "https://geo.example.test/nominatim/reverse?format=jsonv2&lat=59.9133000&lon=10.7390000";
constexpr const char* kOsloAnswer =
    R"({"address":{"city":"Oslo by","state":"Østlandet","postcode":"0150","country_code":"no"}})";

class ReverseGeocoderTest : public testing::Test {
 protected:
  struct Answer {
    std::optional<MapItems> items;
    std::optional<GeoError> error;
  };

  std::shared_ptr<ReverseGeocoder> geocoder(std::string serverUrl, std::string gazetteer = GAZETTEER_DATABASE,
                                            std::chrono::milliseconds pace = 1s) {
    return std::make_shared<ReverseGeocoder>(
        std::move(serverUrl), std::move(gazetteer), web, [this] { return clock.now(); }, pace);
  }
  void ask(const std::shared_ptr<ReverseGeocoder>& of, Coordinate coordinate) {
    of->lookUp(
        coordinate,
        [this](std::optional<MapItems> items, std::optional<GeoError> error) {
          EXPECT_NE(items.has_value(), error.has_value());
          answers.push_back({std::move(items), std::move(error)});
        },
        queue);
    queue->runReady();
  }
  StructuredAddress addressOf(const Answer& answer) {
    EXPECT_TRUE(answer.items && answer.items->size() == 1);
    if (!answer.items || answer.items->empty()) return {};
    return answer.items->at(0)->address->structuredAddress.value();
  }
  void pass(std::chrono::nanoseconds time) {
    clock.advance(time);
    queue->runReady();
  }

  RecordingLog log;
  ManualClock clock;
  std::shared_ptr<ManualWorkQueue> queue = std::make_shared<ManualWorkQueue>(clock, "places");
  ScriptedWebClient web;
  std::vector<Answer> answers;
};

TEST_F(ReverseGeocoderTest, WithoutServerTheGazetteerAnswers) {
  const auto offline = geocoder("");
  ask(offline, kOslo);
  ASSERT_EQ(answers.size(), 1U);
  EXPECT_EQ(addressOf(answers[0]).countryCode, "NO");
  EXPECT_EQ(addressOf(answers[0]).administrativeArea, "Oslo");
  EXPECT_TRUE(web.seen().empty());
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(ReverseGeocoderTest, APlaceNobodyKnowsIsNoMapItems) {
  const auto offline = geocoder("");
  ask(offline, {0, -140});
  ASSERT_EQ(answers.size(), 1U);
  ASSERT_TRUE(answers[0].items);
  EXPECT_TRUE(answers[0].items->empty());
}

TEST_F(ReverseGeocoderTest, WhatIsNoCoordinateIsAnError) {
  constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();
  constexpr double kInfinity = std::numeric_limits<double>::infinity();
  const auto online = geocoder(kServer);
  const std::vector<Coordinate> wrong{{kNaN, 0},       {0, kNaN},       {kNaN, kNaN}, {kInfinity, 0},
                                      {0, -kInfinity}, {90.0000001, 0}, {-91, 0},     {0, 180.0000001},
                                      {0, -181},       {1e308, 1e308}};
  for (const Coordinate& coordinate : wrong) ask(online, coordinate);
  ASSERT_EQ(answers.size(), wrong.size());
  for (const auto& answer : answers)
    EXPECT_EQ(answer.error.value().description, "the coordinate is out of range");
  EXPECT_TRUE(web.seen().empty());
}

TEST_F(ReverseGeocoderTest, TheEdgesOfTheRangeAreCoordinates) {
  const auto offline = geocoder("");
  for (const Coordinate& coordinate : {Coordinate{90, 180}, Coordinate{-90, -180}, Coordinate{0, 180}}) {
    ask(offline, coordinate);
    EXPECT_TRUE(answers.back().items);
  }
}

TEST_F(ReverseGeocoderTest, ALineAboutTheServersAnswerSaysWhoHasAsked) {
  web.answer(kOsloUrl, 500, "");
  const auto online = geocoder(kServer);
  {
    const LogScope scope("BVMobileHelperRequestCountryCodeFromLocation", 7);
    online->lookUp(
        kOslo, [](std::optional<MapItems>, std::optional<GeoError>) {}, queue);
  }
  queue->runReady();
  ASSERT_EQ(log.entries().size(), 1U);
  EXPECT_EQ(log.fields()[0].at("BRENVIK_ROUTINE"), "BVMobileHelperRequestCountryCodeFromLocation");
}

TEST_F(ReverseGeocoderTest, TheServersAnswerIsTaken) {
  web.answer(kOsloUrl, 200, kOsloAnswer);
  const auto online = geocoder(std::string(kServer) + "/");
  ask(online, kOslo);
  ASSERT_EQ(answers.size(), 1U);
  EXPECT_EQ(addressOf(answers[0]).locality, "Oslo by");
  EXPECT_EQ(addressOf(answers[0]).postCode, "0150");
  ASSERT_EQ(web.seen().size(), 1U);
  const auto seen = web.seen()[0];
  EXPECT_EQ(seen.url, kOsloUrl);
  EXPECT_EQ(seen.headers.at("User-Agent"), "BrenvikMobileHelper/" BRENVIK_VERSION);
  EXPECT_EQ(seen.headers.at("Accept"), "application/json");
  EXPECT_EQ(seen.timeLimit, 10s);
  EXPECT_EQ(seen.largestBody, kLargestGeocoderAnswer);
  EXPECT_EQ(seen.bodySize, 0U);
}

TEST_F(ReverseGeocoderTest, PartsOfAnyLengthTravelWholeUpToWhatAPushCarries) {
  const auto online = geocoder(kServer);
  const auto answerWith = [&](const std::string& city, const std::string& state) {
    web.answer(kOsloUrl, 200,
               R"({"address":{"city":")" + city + R"(","state":")" + state +
                   R"(","postcode":"0150","country_code":"no"}})");
    pass(1s);
    ask(online, kOslo);
    return addressOf(answers.back());
  };
  const std::string city(30'000, 'c');
  const std::string state(34'994, 's');  // beside them six bytes
  EXPECT_EQ(answerWith(city, state).locality, city);
  EXPECT_EQ(answerWith(city, state).administrativeArea, state);
  EXPECT_EQ(answerWith(city, state + "s").locality, city);
  EXPECT_EQ(answerWith(city, state + "s").administrativeArea, std::nullopt);
  EXPECT_EQ(answerWith(city + "ø", "s").locality, city + "ø") << "60,002 bytes of UTF-16";
  EXPECT_EQ(answerWith(city + city, "s").locality, city + city);
  EXPECT_EQ(answerWith(city + city + "ø", "s").locality, std::nullopt) << "120,002";
  EXPECT_EQ(answerWith(std::string(70'000, 'c'), "s").postCode, "0150");
  EXPECT_EQ(answerWith(std::string(70'000, 'c'), "s").administrativeArea, "s");
}

TEST_F(ReverseGeocoderTest, TheServersCountryCodeFollowsTheSameRulesAsTheGazetteers) {
  struct Case {
    Coordinate at;
    const char* server;
    const char* own;
  };
  for (const Case& each : {Case{{22.3, 114.17}, "cn", "HK"}, Case{{18.45, -66.07}, "us", "PR"},
                           Case{{44.95, 34.1}, "ru", "UA"}, Case{{59.9133, 10.739}, "no", "NO"}}) {
    answers.clear();
    const auto online = geocoder(kServer);
    ask(online, each.at);
    web.answer(web.seen().back().url, 200,
               std::string(R"({"address":{"city":"C","country_code":")") + each.server + "\"}}");
    ask(geocoder(kServer), each.at);
    ASSERT_FALSE(answers.empty());
    EXPECT_EQ(addressOf(answers.back()).countryCode, each.own);
    EXPECT_EQ(addressOf(answers.back()).locality, "C");
  }
}

TEST_F(ReverseGeocoderTest, AServerOfOnesOwnMayBeAskedWithoutPause) {
  web.answer(kOsloUrl, 200, kOsloAnswer);
  const auto online = geocoder(kServer, GAZETTEER_DATABASE, 0ms);
  for (int i = 0; i < 5; ++i) ask(online, kOslo);
  EXPECT_EQ(web.seen().size(), 5U);
  EXPECT_EQ(answers.size(), 5U);
}

TEST_F(ReverseGeocoderTest, CoordinatesAreSentWithoutExponent) {
  const auto online = geocoder(kServer);
  ask(online, {1e-300, -179.99999999});
  EXPECT_EQ(web.seen().at(0).url,
            std::string(kServer) + "/reverse?format=jsonv2&lat=0.0000000&lon=-180.0000000");
}

TEST_F(ReverseGeocoderTest, UnableToGeocodeIsNoMapItemsAndNotTheGazetteersTurn) {
  web.answer(kOsloUrl, 200, R"({"error":"Unable to geocode"})");
  const auto online = geocoder(kServer);
  ask(online, kOslo);
  ASSERT_EQ(answers.size(), 1U);
  ASSERT_TRUE(answers[0].items);
  EXPECT_TRUE(answers[0].items->empty());
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(ReverseGeocoderTest, WhenTheServerFailsTheGazetteerAnswersAndTheLogSaysSo) {
  const auto expectOffline = [&](const std::string& why) {
    log.clear();
    answers.clear();
    const auto online = geocoder(kServer);
    ask(online, kOslo);
    ASSERT_EQ(answers.size(), 1U) << why;
    EXPECT_EQ(addressOf(answers[0]).countryCode, "NO") << why;
    EXPECT_EQ(addressOf(answers[0]).postCode, std::nullopt) << why;
    ASSERT_EQ(log.entries().size(), 1U) << why;
    EXPECT_NE(log.entries()[0].line.find(why), std::string::npos) << log.entries()[0].line;
  };
  web.fail(kOsloUrl, WebErrorKind::timedOut);
  expectOffline(textOfErrorKind(WebErrorKind::timedOut));
  web.fail(kOsloUrl, WebErrorKind::bodyTooLarge);
  expectOffline(textOfErrorKind(WebErrorKind::bodyTooLarge));
  web.answer(kOsloUrl, 200, "<html>Sign in to the network</html>");
  expectOffline("not a JSON object");
  web.answer(kOsloUrl, 200, R"({"address":{"city":"Os)");
  expectOffline("not a JSON object");
  web.answer(kOsloUrl, 200, R"({"lat":"1"})");
  expectOffline("has no address");
  web.answer(kOsloUrl, 429, kOsloAnswer);
  expectOffline(textOfStatusCode(429));
  web.answer(kOsloUrl, 302, kOsloAnswer);
  expectOffline(textOfStatusCode(302));
  web.answerNothing(kOsloUrl);
  expectOffline("nothing is known");
  web.refuse(kOsloUrl);
  expectOffline("URL cannot be used");
}

TEST_F(ReverseGeocoderTest, WithoutMemoryToAskTheServerTheGazetteerAnswers) {
  web.exhausted = true;
  ask(geocoder(kServer), kOslo);
  ASSERT_EQ(answers.size(), 1U);
  EXPECT_EQ(addressOf(answers[0]).countryCode, "NO");
  EXPECT_EQ(log.entries(), std::vector{RecordingLog::unifiedLine(
                               LogLevel::standard,
                               "geo service: the geocoder failed (no memory or thread is left to ask it), "
                               "the offline gazetteer answers")});
}

TEST_F(ReverseGeocoderTest, WithoutServerAndGazetteerItIsAnError) {
  ask(geocoder("", "/nonexistent/gazetteer.db"), kOslo);
  EXPECT_EQ(answers.at(0).error.value().description,
            "the offline gazetteer cannot be read: unable to open database file");
}

TEST_F(ReverseGeocoderTest, WhenBothFailTheErrorNamesBoth) {
  web.answer(kOsloUrl, 200, "");
  ask(geocoder(kServer, "/nonexistent/gazetteer.db"), kOslo);
  EXPECT_EQ(answers.at(0).error.value().description,
            "the offline gazetteer cannot be read: unable to open database file; the geocoder failed: the "
            "geocoder's answer is not a JSON object");
}

TEST_F(ReverseGeocoderTest, TheServerIsAskedOnceASecondAtMost) {
  web.answer(kOsloUrl, 200, kOsloAnswer);
  const auto online = geocoder(kServer);
  for (int i = 0; i < 3; ++i) ask(online, kOslo);
  EXPECT_EQ(web.seen().size(), 1U);
  pass(999ms);
  EXPECT_EQ(web.seen().size(), 1U);
  pass(1ms);
  EXPECT_EQ(web.seen().size(), 2U);
  pass(1s);
  EXPECT_EQ(web.seen().size(), 3U);
  EXPECT_EQ(answers.size(), 3U);
  pass(10s);
  ask(online, kOslo);
  EXPECT_EQ(web.seen().size(), 4U) << "after a pause, at once";
}

TEST_F(ReverseGeocoderTest, WhoWouldWaitTooLongForHisTurnIsAnsweredOffline) {
  web.answer(kOsloUrl, 200, kOsloAnswer);
  const auto online = geocoder(kServer);
  for (int i = 0; i < 7; ++i) ask(online, kOslo);
  // One at once, four within four seconds, and two for whom that is too long.
  EXPECT_EQ(answers.size(), 3U);
  EXPECT_EQ(log.entries().size(), 2U);
  pass(1min);
  EXPECT_EQ(web.seen().size(), 5U);
  EXPECT_EQ(answers.size(), 7U);
}

TEST_F(ReverseGeocoderTest, AnswersThatCrossAreToldApart) {
  const char* const parisUrl =
      "https://geo.example.test/nominatim/reverse?format=jsonv2&lat=48.8584000&lon=2.2945000";
  web.answer(kOsloUrl, 200, kOsloAnswer);
  web.answer(parisUrl, 200, R"({"address":{"city":"Paris"}})");
  web.holdAnswers();
  const auto online = geocoder(kServer);
  ask(online, kOslo);
  ask(online, {48.8584, 2.2945});
  pass(1s);
  EXPECT_TRUE(answers.empty());
  web.releaseAnswers();
  queue->runReady();
  ASSERT_EQ(answers.size(), 2U);
  EXPECT_EQ(addressOf(answers[0]).locality, "Oslo by");
  EXPECT_EQ(addressOf(answers[1]).locality, "Paris");
}

TEST_F(ReverseGeocoderTest, ClosedItAnswersNothing) {
  web.answer(kOsloUrl, 200, kOsloAnswer);
  web.holdAnswers();
  auto online = geocoder(kServer);
  ask(online, kOslo);
  ask(online, kOslo);
  online->close();
  ask(online, kOslo);
  web.releaseAnswers();
  queue->runReady();
  pass(1min);
  EXPECT_TRUE(answers.empty());
  EXPECT_EQ(web.seen().size(), 1U);
}

TEST_F(ReverseGeocoderTest, AnAnswerThatOutlivesItFindsNobody) {
  web.answer(kOsloUrl, 200, kOsloAnswer);
  web.holdAnswers();
  auto online = geocoder(kServer);
  ask(online, kOslo);
  online.reset();
  web.releaseAnswers();
  queue->runReady();
  EXPECT_TRUE(answers.empty());
}

}  // namespace
}  // namespace brenvik
