// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/location/LocationRoutines.h"

#include <gtest/gtest.h>

#include <array>
#include <cerrno>
#include <limits>
#include <new>

#include "helper/location/GeoRequestState.h"
#include "platform/geo/fakes/ManualGeoService.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/runloop/fakes/ManualRunLoop.h"
#include "platform/telephony/fakes/RecordingTelephonyDaemon.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
using Line = RecordingLog::Entry;
using Lines = std::vector<Line>;
using Push = RecordingTelephonyDaemon::Push;
using Pushes = std::vector<Push>;

constexpr PortName kPort = 17;

Line bsdError(std::string text) { return RecordingLog::bsdLine(SyslogPriority::error, std::move(text)); }
Line bsdNotice(std::string text) { return RecordingLog::bsdLine(SyslogPriority::notice, std::move(text)); }
Line unifiedDebug(std::string text) { return RecordingLog::unifiedLine(LogLevel::debug, std::move(text)); }
Line unifiedDefault(std::string text) {
  return RecordingLog::unifiedLine(LogLevel::standard, std::move(text));
}
Line unifiedError(std::string text) { return RecordingLog::unifiedLine(LogLevel::error, std::move(text)); }

const Line kCivicAsked = bsdError("server_BVMobileHelperRequestCountryCodeFromLocation \n");
const Line kCivicNotAwaited =
    bsdError("_RequestCivicInfoFromLatitudeLongitude wasn't waiting for response from GEO");
const Line kNoMapItems = bsdError("_RequestCivicInfoFromLatitudeLongitude didn't get any mapItems\n");
const Line kCivicSent = bsdNotice("sendCivicInfoToQV sent civic info to Brenvik successfully");
const Line kNoCountryCode = bsdError("Didn't get valid country code from GeoService.\n");
const Line kWanIpAsked = unifiedDebug("server_BVMobileHelperRequestWanIPFromLocation");
const Line kWanIpNotAwaited =
    unifiedDefault("_RequestWanIPFromLocation wasn't waiting for response from GEO");
const Line kWanIpSent = unifiedDefault("sendWanIPToQV sent WAN IP to Brenvik successfully");

Push civic(std::string countryCode, std::string state, std::string city, std::string postalCode) {
  return {"civic", {std::move(countryCode), std::move(state), std::move(city), std::move(postalCode)}};
}
Push address(std::string text) { return {"address", {std::move(text)}}; }

MapItem placeWith(StructuredAddress structured) { return {true, GeoAddress{std::move(structured)}}; }

class LocationRoutinesTest : public testing::Test {
 protected:
  LocationRoutinesTest() { geo.countryCode = "NO"; }

  KernelReturn askCivicInfo(double latitude = 48.8584, double longitude = 2.2945) {
    return routines->requestCountryCodeFromLocation(kPort, latitude, longitude);
  }
  KernelReturn askWanIp() { return routines->requestWanIPFromLocation(kPort); }

  ManualWorkQueue& geoQueue() { return *queues.serial.at(0); }
  // Lets both queues work until neither has anything left.
  void settle() {
    int ran = 1;
    while (ran > 0) {
      ran = queues.main().runReady();
      for (const auto& queue : queues.serial) ran += queue->runReady();
    }
  }
  void pass(std::chrono::nanoseconds time) {
    clock.advance(time);
    settle();
  }

  RecordingLog log;
  ManualClock clock;
  ManualWorkQueues queues{clock};
  ManualGeoService geo;
  RecordingTelephonyDaemon brenvik;
  GeoRequestState state;
  std::unique_ptr<LocationRoutines> routines =
      std::make_unique<LocationRoutines>(queues, geo, brenvik, state);
};

// ---- dispatch ---------------------------------------------------------------------------------------------

TEST_F(LocationRoutinesTest, NoQueueIsMadeBeforeTheFirstGeoRequest) {
  std::array<char, 64> code{};
  routines->copyCountryCode(kPort, code.data());
  EXPECT_TRUE(queues.serial.empty());
}

TEST_F(LocationRoutinesTest, AllRequestsShareOneUtilityQueueMadeOnce) {
  askCivicInfo();
  askWanIp();
  settle();
  askCivicInfo();
  ASSERT_EQ(queues.serial.size(), 1U);
  EXPECT_EQ(geoQueue().label(), "GEO callback queue");
  EXPECT_EQ(geoQueue().qualityOfService(), QualityOfService::utility);
  LocationRoutines second(queues, geo, brenvik, state);
  second.requestWanIPFromLocation(kPort);
  EXPECT_EQ(queues.serial.size(), 1U);
}

TEST_F(LocationRoutinesTest, TheProcessHasOneSharedState) {
  EXPECT_EQ(&GeoRequestState::shared(), &GeoRequestState::shared());
  EXPECT_FALSE(GeoRequestState::shared().isAwaitingGeoResponse());
}

TEST_F(LocationRoutinesTest, HowTheLastRequestEndedIsKeptAndLateAnswersDoNotCount) {
  using Ending = GeoRequestState::Ending;
  EXPECT_FALSE(state.lastEnding());
  askCivicInfo();
  settle();
  EXPECT_FALSE(state.lastEnding());
  geo.reverseGeocodes.at(0).answer(MapItems{});
  settle();
  ASSERT_TRUE(state.lastEnding());
  EXPECT_EQ(state.lastEnding()->ending, Ending::answered);
  askWanIp();
  settle();
  geo.geoIps.at(0).fail("none");
  settle();
  EXPECT_EQ(state.lastEnding()->ending, Ending::failed);
  askWanIp();
  settle();
  pass(5s);
  EXPECT_EQ(state.lastEnding()->ending, Ending::timedOut);
  geo.geoIps.at(1).answer("198.51.100.7");
  settle();
  EXPECT_EQ(state.lastEnding()->ending, Ending::timedOut);
}

TEST_F(LocationRoutinesTest, RoutinesAnswerBeforeTheGeoServiceIsAsked) {
  EXPECT_EQ(askCivicInfo(), kern::success);
  EXPECT_EQ(askWanIp(), kern::success);
  EXPECT_TRUE(geo.reverseGeocodes.empty());
  EXPECT_TRUE(geo.geoIps.empty());
  EXPECT_FALSE(state.isAwaitingGeoResponse());
  EXPECT_EQ(log.entries(), (Lines{kCivicAsked, kWanIpAsked}));
}

TEST_F(LocationRoutinesTest, ARequestGoesStraightToItsQueueWhateverTheMainQueueDoes) {
  askCivicInfo();
  askWanIp();
  EXPECT_EQ(geoQueue().pending(), 2U);
  EXPECT_EQ(queues.main().pending(), 0U);
  geoQueue().runReady();
  EXPECT_EQ(geo.reverseGeocodes.size(), 1U);
  EXPECT_EQ(geo.geoIps.size(), 1U);
}

TEST_F(LocationRoutinesTest, CivicTicketHasTheArgumentsOfTheHelperItself) {
  askCivicInfo(-33.8568, 151.2153);
  settle();
  ASSERT_EQ(geo.reverseGeocodes.size(), 1U);
  const auto& question = geo.reverseGeocodes[0];
  EXPECT_EQ(question.coordinate.latitude, -33.8568);
  EXPECT_EQ(question.coordinate.longitude, 151.2153);
  EXPECT_EQ(question.includeEta, IncludeEta::no);
  EXPECT_EQ(question.shiftLocations, ShiftLocations::ifNeeded);
  EXPECT_EQ(question.traits, nullptr);
  EXPECT_EQ(question.networkActivity, nullptr);
  EXPECT_EQ(question.handlerQueue.lock(), queues.serial[0]);
  EXPECT_EQ(geo.ticketsAlive, 0);
  EXPECT_TRUE(state.isAwaitingGeoResponse());
}

TEST_F(LocationRoutinesTest, WanIpTicketHasTheArgumentsOfTheHelperItself) {
  askWanIp();
  settle();
  ASSERT_EQ(geo.geoIps.size(), 1U);
  EXPECT_EQ(geo.geoIps[0].ipAddress, std::nullopt);
  EXPECT_EQ(geo.geoIps[0].auditToken, nullptr);
  EXPECT_EQ(geo.geoIps[0].networkActivity, nullptr);
  EXPECT_EQ(geo.geoIps[0].handlerQueue.lock(), queues.serial[0]);
  EXPECT_EQ(geo.ticketsAlive, 0);
  EXPECT_TRUE(state.isAwaitingGeoResponse());
}

TEST_F(LocationRoutinesTest, TheTimeOutIsFiveSecondsToTheNanosecond) {
  askWanIp();
  settle();
  pass(4'999'999'999ns);
  EXPECT_TRUE(state.isAwaitingGeoResponse());
  EXPECT_TRUE(brenvik.pushes.empty());
  pass(1ns);
  EXPECT_FALSE(state.isAwaitingGeoResponse());
  EXPECT_EQ(brenvik.pushes, (Pushes{address("")}));
}

TEST_F(LocationRoutinesTest, TheTimeOutCountsFromTheSubmissionNotFromTheRequest) {
  askWanIp();
  clock.advance(3s);  // the queue was busy
  settle();
  pass(4s);
  EXPECT_TRUE(brenvik.pushes.empty());
  pass(1s);
  EXPECT_EQ(brenvik.pushes.size(), 1U);
}

TEST_F(LocationRoutinesTest, ATimeOutAfterTheAnswerDoesNothingAndLogsNothing) {
  askCivicInfo();
  settle();
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = "FR"})});
  settle();
  log.clear();
  const auto pushes = brenvik.pushes;
  pass(1h);
  EXPECT_EQ(log.entries(), Lines{});
  EXPECT_EQ(brenvik.pushes, pushes);
}

TEST_F(LocationRoutinesTest, ATimeOutAfterTheWanIpAnswerDoesNothingAndLogsNothing) {
  askWanIp();
  settle();
  geo.geoIps[0].answer("198.51.100.7");
  settle();
  log.clear();
  pass(1h);
  EXPECT_EQ(log.entries(), Lines{});
  EXPECT_EQ(brenvik.pushes, (Pushes{address("198.51.100.7")}));
}

TEST_F(LocationRoutinesTest, OfTwoCivicInfoRequestsOnlyTheFirstEventDoesWork) {
  askCivicInfo(48.8584, 2.2945);
  askCivicInfo(51.5007, -0.1246);
  settle();
  log.clear();
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = "FR"})});
  geo.reverseGeocodes[1].answer(MapItems{placeWith({.countryCode = "GB"})});
  settle();
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("FR", "", "", "")}));
  EXPECT_EQ(log.entries(), (Lines{bsdNotice("_RequestCivicInfoFromLatitudeLongitude mapItems: (1)"),
                                  bsdNotice("_RequestCivicInfoFromLatitudeLongitude country code: FR"),
                                  kCivicSent, kCivicNotAwaited}));
  pass(1h);
  EXPECT_EQ(brenvik.pushes.size(), 1U);
}

TEST_F(LocationRoutinesTest, TheSecondRequestsAnswerMayBeTheFirstEvent) {
  askCivicInfo(48.8584, 2.2945);
  askCivicInfo(51.5007, -0.1246);
  settle();
  geo.reverseGeocodes[1].answer(MapItems{placeWith({.countryCode = "GB"})});
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = "FR"})});
  settle();
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("GB", "", "", "")}));
}

TEST_F(LocationRoutinesTest, ALaterRequestRearmsTheFlagForTheEarlierOnesAnswer) {
  askCivicInfo(48.8584, 2.2945);
  settle();
  pass(5s);  // the first one's time-out
  ASSERT_EQ(brenvik.pushes.size(), 1U);
  askCivicInfo(51.5007, -0.1246);
  settle();
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = "FR"})});  // late, and taken all the same
  settle();
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", ""), civic("FR", "", "", "")}));
  geo.reverseGeocodes[1].answer(MapItems{placeWith({.countryCode = "GB"})});
  settle();
  EXPECT_EQ(brenvik.pushes.size(), 2U);
}

TEST_F(LocationRoutinesTest, TheEarlierRequestsTimeOutSettlesTheLaterOneToo) {
  askCivicInfo();
  settle();
  pass(3s);
  askCivicInfo();
  settle();
  pass(2s);
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", "")}));
  log.clear();
  geo.reverseGeocodes[1].answer(MapItems{placeWith({.countryCode = "GB"})});
  settle();
  EXPECT_EQ(log.entries(), Lines{kCivicNotAwaited});
  pass(1h);
  EXPECT_EQ(brenvik.pushes.size(), 1U);
}

TEST_F(LocationRoutinesTest, AWanIpRequestSharesTheFlagWithAnOutstandingCivicInfoRequest) {
  askCivicInfo();
  askWanIp();
  settle();
  log.clear();
  geo.geoIps[0].answer("198.51.100.7");
  settle();
  EXPECT_EQ(brenvik.pushes, (Pushes{address("198.51.100.7")}));
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = "FR"})});
  settle();
  pass(1h);
  EXPECT_EQ(brenvik.pushes.size(), 1U);
  EXPECT_EQ(log.entries(), (Lines{unifiedDefault("_RequestWanIPFromLocation WAN IP: 198.51.100.7"),
                                  kWanIpSent, kCivicNotAwaited}));
}

TEST_F(LocationRoutinesTest, ACivicTimeOutLeavesNothingForTheWanIpAnswer) {
  askCivicInfo();
  askWanIp();
  settle();
  pass(5s);
  log.clear();
  geo.geoIps[0].answer("198.51.100.7");
  settle();
  EXPECT_EQ(log.entries(), Lines{kWanIpNotAwaited});
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", "")}));
}

TEST_F(LocationRoutinesTest, ClosedRoutinesDropWhatIsStillUnderWay) {
  askCivicInfo();
  settle();
  askWanIp();
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = "FR"})});
  routines.reset();
  log.clear();
  settle();
  pass(1h);
  EXPECT_TRUE(brenvik.pushes.empty());
  EXPECT_EQ(log.entries(), Lines{});
  EXPECT_TRUE(geo.geoIps.empty());
}

TEST_F(LocationRoutinesTest, ClosedRoutinesDropAnAddressThatIsStillUnderWay) {
  askWanIp();
  settle();
  geo.geoIps.at(0).answer("198.51.100.7");
  routines.reset();
  log.clear();
  settle();
  EXPECT_TRUE(brenvik.pushes.empty());
  EXPECT_EQ(log.entries(), Lines{});
}

TEST_F(LocationRoutinesTest, AnExceptionWhileQueueingARequestEndsTheProcess) {
  class QueuesWithoutMemory final : public WorkQueues {
   public:
    explicit QueuesWithoutMemory(ManualWorkQueues& others) : others_(others) {}
    WorkQueue& main() noexcept override { return others_.main(); }
    WorkQueue& global() override { return others_.global(); }
    std::shared_ptr<WorkQueue> makeSerial(std::string, QualityOfService) override { throw std::bad_alloc(); }
    std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t, std::uint32_t, WorkQueue::Task,
                                                             WorkQueue::Task) override {
      return nullptr;
    }

   private:
    ManualWorkQueues& others_;
  };
  QueuesWithoutMemory none(queues);
  GeoRequestState fresh;
  LocationRoutines starved(none, geo, brenvik, fresh);
  testing::FLAGS_gtest_death_test_style = "threadsafe";
  EXPECT_DEATH(starved.requestWanIPFromLocation(kPort), "");
  EXPECT_DEATH(starved.requestCountryCodeFromLocation(kPort, 1, 1), "");
}

// ---- civic info -------------------------------------------------------------------------------------------

TEST_F(LocationRoutinesTest, AWholeAddressIsLoggedAndPushed) {
  askCivicInfo();
  settle();
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = "FR",
                                                    .administrativeArea = "Île-de-France",
                                                    .locality = "Paris",
                                                    .postCode = "75007"})});
  settle();
  EXPECT_EQ(log.entries(),
            (Lines{kCivicAsked, bsdNotice("_RequestCivicInfoFromLatitudeLongitude mapItems: (1)"),
                   bsdNotice("_RequestCivicInfoFromLatitudeLongitude country code: FR"),
                   bsdNotice("_RequestCivicInfoFromLatitudeLongitude state: Île-de-France"),
                   bsdNotice("_RequestCivicInfoFromLatitudeLongitude city: Paris"),
                   bsdNotice("_RequestCivicInfoFromLatitudeLongitude postal code: 75007"), kCivicSent}));
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("FR", "Île-de-France", "Paris", "75007")}));
  EXPECT_EQ(geo.countryCodeQuestions, 0);
  EXPECT_EQ(brenvik.connectionsOpen, 0);
}

TEST_F(LocationRoutinesTest, LatitudeAndLongitudeZeroAreNotLookedUp) {
  EXPECT_EQ(askCivicInfo(0.0, 0.0), kern::success);
  queues.main().runReady();
  geoQueue().runReady();
  EXPECT_FALSE(state.isAwaitingGeoResponse());
  EXPECT_EQ(clock.scheduled(), 0U) << "no time-out is armed";
  EXPECT_EQ(queues.main().pending(), 1U) << "the fallback goes by way of the main queue";
  settle();
  EXPECT_TRUE(geo.reverseGeocodes.empty());
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", "")}));
  EXPECT_EQ(log.entries(), (Lines{kCivicAsked, kCivicSent}));
}

TEST_F(LocationRoutinesTest, ThePositionZeroLeavesAnOutstandingRequestAlone) {
  askCivicInfo();
  settle();
  askCivicInfo(0.0, -0.0);
  settle();
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", "")}));
  EXPECT_TRUE(state.isAwaitingGeoResponse());
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = "FR"})});
  settle();
  EXPECT_EQ(brenvik.pushes.size(), 2U);
}

TEST_F(LocationRoutinesTest, APositionWithOnlyOneOfTheTwoAtZeroIsLookedUp) {
  askCivicInfo(51.4779, 0.0);
  askCivicInfo(0.0, 32.4637);
  settle();
  EXPECT_EQ(geo.reverseGeocodes.size(), 2U);
}

TEST_F(LocationRoutinesTest, NumbersThatAreNoPositionAreTheGeoServicesToJudge) {
  askCivicInfo(std::numeric_limits<double>::quiet_NaN(), 0.0);
  askCivicInfo(std::numeric_limits<double>::infinity(), -std::numeric_limits<double>::infinity());
  settle();
  ASSERT_EQ(geo.reverseGeocodes.size(), 2U);
  geo.reverseGeocodes[0].fail("not a coordinate");
  settle();
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", "")}));
}

TEST_F(LocationRoutinesTest, AMapItemWithACityAndNoCountryCodeIsPushedWithTheConfiguredCountryCode) {
  askCivicInfo();
  settle();
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.locality = "Paris"})});
  settle();
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "Paris", "")}));
}

TEST_F(LocationRoutinesTest, AnEmptyCountryCodeIsReplacedToo) {
  askCivicInfo();
  settle();
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = ""})});
  settle();
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", "")}));
  EXPECT_EQ(log.entries()[2], bsdNotice("_RequestCivicInfoFromLatitudeLongitude country code: "));
}

TEST_F(LocationRoutinesTest, AnErrorAnswerIsTwoLogLinesAndAPushOfTheConfiguredCountryCode) {
  askCivicInfo();
  settle();
  geo.reverseGeocodes[0].fail("no route to the server");
  settle();
  EXPECT_EQ(
      log.entries(),
      (Lines{kCivicAsked, bsdError("_RequestCivicInfoFromLatitudeLongitude error: (no route to the server)"),
             kNoMapItems, kCivicSent}));
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", "")}));
}

TEST_F(LocationRoutinesTest, AnErrorGivenWithItemsIsStillAnError) {
  askCivicInfo();
  settle();
  geo.reverseGeocodes[0].post(MapItems{placeWith({.countryCode = "FR"})}, GeoError{"half an answer"});
  settle();
  EXPECT_EQ(log.entries(),
            (Lines{kCivicAsked, bsdError("_RequestCivicInfoFromLatitudeLongitude error: (half an answer)"),
                   kNoMapItems, kCivicSent}));
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", "")}));
}

TEST_F(LocationRoutinesTest, AnAbsentAndAnEmptyArrayAreNoMapItems) {
  for (const auto& items : {std::optional<MapItems>(), std::optional<MapItems>(MapItems{})}) {
    log.clear();
    askCivicInfo();
    settle();
    geo.reverseGeocodes.back().answer(items);
    settle();
    EXPECT_EQ(log.entries(), (Lines{kCivicAsked, kNoMapItems, kCivicSent}));
  }
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", ""), civic("NO", "", "", "")}));
}

TEST_F(LocationRoutinesTest, NoAnswerWithinFiveSecondsIsAPushOfTheConfiguredCountryCode) {
  askCivicInfo();
  settle();
  pass(5s);
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", "")}));
  EXPECT_EQ(log.entries(), (Lines{kCivicAsked, kCivicSent}));
  log.clear();
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = "FR"})});
  settle();
  EXPECT_EQ(log.entries(), Lines{kCivicNotAwaited});
  EXPECT_EQ(brenvik.pushes.size(), 1U);
  EXPECT_FALSE(state.isAwaitingGeoResponse());
}

TEST_F(LocationRoutinesTest, OfSeveralMapItemsOnlyTheFirstIsUsed) {
  askCivicInfo();
  settle();
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = "FR"}),
                                         placeWith({.countryCode = "DE", .locality = "Kehl"}), std::nullopt});
  settle();
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("FR", "", "", "")}));
  EXPECT_EQ(log.entries()[1], bsdNotice("_RequestCivicInfoFromLatitudeLongitude mapItems: (3)"));
}

TEST_F(LocationRoutinesTest, AnAbsentOrInvalidFirstMapItemIsLoggedAndPushedWithoutAddress) {
  MapItem invalid = placeWith({.countryCode = "FR"});
  invalid.valid = false;
  for (const auto& first : {std::optional<MapItem>(), std::optional<MapItem>(invalid)}) {
    log.clear();
    askCivicInfo();
    settle();
    geo.reverseGeocodes.back().answer(MapItems{first, placeWith({.countryCode = "DE"})});
    settle();
    EXPECT_EQ(log.entries(),
              (Lines{kCivicAsked, bsdNotice("_RequestCivicInfoFromLatitudeLongitude mapItems: (2)"),
                     bsdError("_RequestCivicInfoLatitudeLongitude NULL mapItem \n"), kCivicSent}));
  }
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", ""), civic("NO", "", "", "")}));
}

TEST_F(LocationRoutinesTest, AMapItemWithoutStructuredAddressIsLoggedAndPushedWithoutAddress) {
  for (const auto& item : {MapItem{true, std::nullopt}, MapItem{true, GeoAddress{}}}) {
    log.clear();
    askCivicInfo();
    settle();
    geo.reverseGeocodes.back().answer(MapItems{item});
    settle();
    EXPECT_EQ(log.entries(),
              (Lines{kCivicAsked, bsdNotice("_RequestCivicInfoFromLatitudeLongitude mapItems: (1)"),
                     bsdError("_RequestCivicInfoLatitudeLongitude mapItem didn't get a structured address"),
                     kCivicSent}));
  }
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("NO", "", "", ""), civic("NO", "", "", "")}));
}

TEST_F(LocationRoutinesTest, WithoutAnyCountryCodeAnEmptyOneIsPushed) {
  geo.countryCode.reset();
  askCivicInfo();
  settle();
  geo.reverseGeocodes[0].answer(MapItems{});
  settle();
  EXPECT_EQ(log.entries(), (Lines{kCivicAsked, kNoMapItems, kNoCountryCode, kCivicSent}));
  EXPECT_EQ(brenvik.pushes, (Pushes{civic("", "", "", "")}));
}

TEST_F(LocationRoutinesTest, TheFallbackSaysThatNoCountryCodeIsKnownBeforeItIsPushed) {
  geo.countryCode.reset();
  askCivicInfo(0.0, 0.0);
  settle();
  EXPECT_EQ(log.entries(), (Lines{kCivicAsked, kNoCountryCode, kCivicSent}));
}

TEST_F(LocationRoutinesTest, ATextThatIsNotUtf8IsPushedAsAbsent) {
  askCivicInfo();
  settle();
  geo.reverseGeocodes[0].answer(MapItems{placeWith({.countryCode = "FR", .locality = "\xff\xfe"})});
  settle();
  EXPECT_EQ(brenvik.pushes, (Pushes{{"civic", {"FR", "", std::nullopt, ""}}}));
}

TEST_F(LocationRoutinesTest, WithoutBrenvikTheCivicPushIsOneLine) {
  brenvik.absent = true;
  askCivicInfo(0.0, 0.0);
  settle();
  EXPECT_EQ(log.entries(),
            (Lines{kCivicAsked,
                   bsdError("sendCivicInfoToQV to Brenvik failed, could not open QVServerConnection")}));
}

TEST_F(LocationRoutinesTest, ARefusedCivicPushIsLoggedWithItsCode) {
  brenvik.result = telephonyResult(kPosixErrorDomain, ETIMEDOUT);
  askCivicInfo(0.0, 0.0);
  settle();
  EXPECT_EQ(
      log.entries(),
      (Lines{kCivicAsked, bsdNotice("sendCivicInfoToQV failed civic info to Brenvik due to error: 110")}));
  EXPECT_EQ(brenvik.connectionsOpen, 0);
}

TEST_F(LocationRoutinesTest, OnlyTheUpperHalfOfTheResultIsAnError) {
  brenvik.result = telephonyResult(0xFFFFFFFF, 0);
  askCivicInfo(0.0, 0.0);
  settle();
  EXPECT_EQ(log.entries().back(), kCivicSent);
  brenvik.result = telephonyResult(0, -304);
  askCivicInfo(0.0, 0.0);
  settle();
  EXPECT_EQ(log.entries().back(),
            bsdNotice("sendCivicInfoToQV failed civic info to Brenvik due to error: -304"));
}

TEST_F(LocationRoutinesTest, EachPushHasAConnectionOfItsOwnInTheHelpersName) {
  askCivicInfo(0.0, 0.0);
  settle();
  askWanIp();
  settle();
  geo.geoIps[0].answer("198.51.100.7");
  settle();
  EXPECT_EQ(brenvik.connectionsMade, 2);
  EXPECT_EQ(brenvik.connectionsOpen, 0);
  const std::vector<std::string> name{"BrenvikMobileHelper"};
  EXPECT_EQ(brenvik.identifiersAtCreate, (std::vector<std::vector<std::string>>{name, name}));
}

TEST_F(LocationRoutinesTest, TheConnectionCallbackOnlyLogs) {
  brenvik.speaksOutOfTurn = true;
  askCivicInfo(0.0, 0.0);
  settle();
  EXPECT_EQ(log.entries(),
            (Lines{kCivicAsked, bsdNotice("_ServerConnectionCallback for BrenvikMobileHelper"), kCivicSent}));
}

TEST_F(LocationRoutinesTest, NoPushEverWaitsOnTheMainQueue) {
  bool onMain = false;
  brenvik.whenCreated = [&] { onMain = onMain || queues.main().isCurrent(); };
  askCivicInfo(0.0, 0.0);  // fallback at once
  settle();
  askCivicInfo();
  settle();
  pass(5s);  // fallback by time-out
  askWanIp();
  settle();
  pass(5s);
  askWanIp();
  settle();
  geo.geoIps.back().answer("198.51.100.7");
  settle();
  EXPECT_EQ(brenvik.pushes.size(), 4U);
  EXPECT_FALSE(onMain);
}

// ---- country code -----------------------------------------------------------------------------------------

TEST_F(LocationRoutinesTest, NoCountryCodeIsABufferOfNulsAndOneErrorLine) {
  geo.countryCode.reset();
  std::array<char, 64> reply;
  reply.fill('x');
  EXPECT_EQ(routines->copyCountryCode(kPort, reply.data()), kern::success);
  EXPECT_EQ(reply, (std::array<char, 64>{}));
  EXPECT_EQ(log.entries(), Lines{kNoCountryCode});
}

TEST_F(LocationRoutinesTest, ATwoLetterCountryCodeIsFollowedBySixtyTwoNuls) {
  std::array<char, 64> reply;
  reply.fill('x');
  EXPECT_EQ(routines->copyCountryCode(kPort, reply.data()), kern::success);
  EXPECT_EQ(reply, (std::array<char, 64>{'N', 'O'}));
  EXPECT_EQ(log.entries(), Lines{});
}

TEST_F(LocationRoutinesTest, ACountryCodeOfSixtyFourBytesOrMoreIsCutWithoutTerminatingNul) {
  for (const std::size_t length : {63U, 64U, 65U, 1000U}) {
    geo.countryCode = std::string(length, 'A');
    std::array<char, 66> reply;
    reply.fill('x');
    EXPECT_EQ(routines->copyCountryCode(kPort, reply.data()), kern::success);
    const std::size_t kept = std::min<std::size_t>(length, 64);
    EXPECT_EQ(std::string(reply.data(), 66), std::string(kept, 'A') + std::string(64 - kept, '\0') + "xx")
        << length;
  }
}

TEST_F(LocationRoutinesTest, ACountryCodeEndsAtItsFirstNul) {
  geo.countryCode = std::string("NO\0SE", 5);
  std::array<char, 64> reply;
  reply.fill('x');
  routines->copyCountryCode(kPort, reply.data());
  EXPECT_EQ(reply, (std::array<char, 64>{'N', 'O'}));
}

// ---- WAN IP -----------------------------------------------------------------------------------------------

TEST_F(LocationRoutinesTest, TheWanIpIsLoggedAndPushed) {
  askWanIp();
  settle();
  geo.geoIps[0].answer("2001:db8::17");
  settle();
  EXPECT_EQ(
      log.entries(),
      (Lines{kWanIpAsked, unifiedDefault("_RequestWanIPFromLocation WAN IP: 2001:db8::17"), kWanIpSent}));
  EXPECT_EQ(brenvik.pushes, (Pushes{address("2001:db8::17")}));
  EXPECT_EQ(brenvik.connectionsOpen, 0);
}

TEST_F(LocationRoutinesTest, NoWanIpWithinFiveSecondsIsAPushOfAnEmptyAddressAndTheLateAnswerIsDropped) {
  askWanIp();
  settle();
  pass(5s);
  EXPECT_EQ(brenvik.pushes, (Pushes{address("")}));
  EXPECT_EQ(log.entries(), (Lines{kWanIpAsked, kWanIpSent}));
  log.clear();
  geo.geoIps[0].answer("198.51.100.7");
  settle();
  EXPECT_EQ(log.entries(), Lines{kWanIpNotAwaited});
  EXPECT_EQ(brenvik.pushes.size(), 1U);
}

TEST_F(LocationRoutinesTest, AWanIpErrorIsOneErrorLineAndAPushOfAnEmptyAddress) {
  askWanIp();
  settle();
  geo.geoIps[0].fail("no answer");
  settle();
  EXPECT_EQ(log.entries(),
            (Lines{kWanIpAsked, unifiedError("_RequestWanIPFromLocation error: (no answer)"), kWanIpSent}));
  EXPECT_EQ(brenvik.pushes, (Pushes{address("")}));
}

TEST_F(LocationRoutinesTest, AWanIpResultWithoutAddressIsPushedEmpty) {
  for (const auto& result : {std::optional<GeoIpResult>(), std::optional<GeoIpResult>(GeoIpResult{})}) {
    askWanIp();
    settle();
    geo.geoIps.back().post(result, std::nullopt);
    settle();
    EXPECT_EQ(brenvik.pushes.back(), address(""));
  }
  EXPECT_EQ(log.entries()[1], unifiedDefault("_RequestWanIPFromLocation WAN IP: "));
}

TEST_F(LocationRoutinesTest, AnAddressThatIsNotUtf8IsPushedAsAbsent) {
  askWanIp();
  settle();
  geo.geoIps[0].answer("\xff");
  settle();
  EXPECT_EQ(brenvik.pushes, (Pushes{{"address", {std::nullopt}}}));
}

TEST_F(LocationRoutinesTest, WithoutBrenvikTheWanIpPushIsOneErrorLine) {
  brenvik.absent = true;
  askWanIp();
  settle();
  pass(5s);
  EXPECT_EQ(log.entries(),
            (Lines{kWanIpAsked,
                   unifiedError("sendWanIPToQV to Brenvik failed, could not open QVServerConnection")}));
}

TEST_F(LocationRoutinesTest, ARefusedWanIpPushIsAnErrorLineWithItsCode) {
  brenvik.result = telephonyResult(kPosixErrorDomain, EPIPE);
  askWanIp();
  settle();
  pass(5s);
  EXPECT_EQ(log.entries(),
            (Lines{kWanIpAsked, unifiedError("sendWanIPToQV failed WAN IP to Brenvik due to error: 32")}));
}

}  // namespace
}  // namespace brenvik
