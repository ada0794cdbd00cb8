// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/lasd/LASDUpdater.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <utility>

#include "Helper/Shared/Server/HelperServerUtils.h"
#include "helper/lasd/DatabaseTypes.h"
#include "helper/lasd/LasdTestSupport.h"
#include "platform/base/fakes/FailingAllocations.h"
#include "platform/ipc/fakes/FakePorts.h"
#include "platform/messageport/fakes/RecordingMessagePorts.h"
#include "platform/plist/PropertyListCodec.h"
#include "platform/preferences/fakes/InMemoryPreferences.h"

namespace brenvik {
namespace {

const std::string kManifest = "https://server.example/1/v3/lasd.plist";
constexpr std::uint32_t kAll = 31;
using Entries = std::vector<std::pair<std::string, PropertyList>>;

PropertyList record(const char* version, const std::string& url) {
  return PropertyList::dictionary(
      {{"Version", PropertyList::string(version)}, {"ContentURL", PropertyList::string(url)}});
}

class LASDUpdaterTest : public LasdTest {
 protected:
  void SetUp() override {
    LasdTest::SetUp();
    directory = folder / "LASD";
    updater->configure({queues, web, gunzip, preferences, messagePorts, kManifest, directory, roomyDisk});
  }
  void TearDown() override {
    updater->shutDown();
    LasdTest::TearDown();
  }

  static std::string urlOf(const std::string& name) { return "https://server.example/" + name + ".db.gz"; }
  void serveManifest(Entries entries, PropertyListFormat format = PropertyListFormat::xml) {
    web.answer(kManifest, 200, *serializePropertyList(PropertyList::dictionary(std::move(entries)), format));
  }
  // All five in this version, their contents included.
  void serveAll(const char* version) {
    Entries entries;
    for (const char* name : {"umts", "cdma", "lte", "gsm", "scdma"}) {
      entries.emplace_back(name, record(version, urlOf(name)));
      serveGzip(urlOf(name), std::string(name) + " " + version);
    }
    serveManifest(entries);
  }
  void setLocal(const char* name, const PropertyList& value) {
    preferences.setValue(name, value, "com.norvale.lasd", UserScope::currentUser, HostScope::anyHost);
  }
  PropertyList local(const char* name) {
    return preferences.copyValue(name, "com.norvale.lasd", UserScope::currentUser, HostScope::anyHost);
  }
  // A whole check, run here.
  void check(std::uint32_t mask) {
    updater->checkForUpdate(server, mask);
    ASSERT_NE(queues.updater, nullptr);
    queues.updater->runReady();
  }
  // The notifications so far, as "name" or "name type", without their common beginning.
  std::vector<std::string> notifications() const {
    std::vector<std::string> result;
    for (const auto& message : messagePorts.messages()) {
      const PropertyList notification = parsePropertyList(message.data);
      std::string text(notification.find("Notification").asString().value_or("?"));
      EXPECT_TRUE(text.starts_with("com.norvale.lasd."));
      text = text.substr(std::string("com.norvale.lasd.").size());
      if (const auto type = notification.find("DBType").asString()) text += " " + std::string(*type);
      result.push_back(text);
    }
    return result;
  }
  // Every URL asked for, in order.
  std::vector<std::string> fetched() const {
    std::vector<std::string> result;
    for (const auto& seen : web.seen()) result.push_back(seen.url);
    return result;
  }
  bool logged(const RecordingLog::Entry& line) const {
    const auto lines = log.entries();
    return std::find(lines.begin(), lines.end(), line) != lines.end();
  }
  // What isUpToDate() says of a type whose local record and server entry are these, and its one line.
  std::pair<bool, std::string> judge(const PropertyList& localRecord, const PropertyList& serverEntry) {
    setLocal("lte", localRecord);
    updater->loadVersions("com.norvale.lasd", LASDUpdater::VersionSource::preferences, lte);
    log.clear();
    const bool result = updater->isUpToDate(
        PropertyList::dictionary({{"lte", serverEntry}, {"other", PropertyList::boolean(true)}}), lte);
    const auto lines = log.entries();
    EXPECT_EQ(lines.size(), 1U);
    if (lines.size() != 1) return {result, ""};
    EXPECT_EQ(lines[0], info(lines[0].line));
    return {result, lines[0].line};
  }
  static PropertyList versionOnly(const char* version) {
    return PropertyList::dictionary({{"Version", PropertyList::string(version)}});
  }

  ManualClock clock;
  ManualRunLoop loop{clock};
  FakePortSpace ports;
  FakeBootstrap bootstrap{ports};
  FakePortSources sources;
  PortServerRegistry registry;
  NoRoutines routines;
  const std::unique_ptr<ServerContext> owned =
      CreateServer(ServerPlatform{ports, bootstrap, sources, loop,
                                  [](const char*, const AuditToken&) { return true; }, registry},
                   kServiceName, routines);
  ServerContext& server = *owned;
  std::filesystem::path directory;
  InMemoryPreferences preferences;
  RecordingMessagePorts messagePorts;
  std::shared_ptr<LASDUpdater> updater = std::make_shared<LASDUpdater>();
};

// ---- a check ----

TEST_F(LASDUpdaterTest, OnAFirstRunWithoutPreferencesEverythingTheManifestListsIsInstalledInOrder) {
  serveAll("1.0");
  check(kAll);
  EXPECT_EQ(fetched(), (std::vector<std::string>{kManifest, urlOf("gsm"), urlOf("umts"), urlOf("cdma"),
                                                 urlOf("lte"), urlOf("scdma")}));
  EXPECT_EQ(notifications(),
            (std::vector<std::string>{"UpdateAvailable gsm", "UpdateAvailable umts", "UpdateAvailable cdma",
                                      "UpdateAvailable lte", "UpdateAvailable scdma"}));
  for (const char* name : {"umts", "cdma", "lte", "gsm", "scdma"}) {
    EXPECT_EQ(contentOf(directory / (std::string(name) + ".db")), std::string(name) + " 1.0");
    EXPECT_EQ(local(name), record("1.0", urlOf(name)));
  }
  EXPECT_EQ(server.busyMask(), 0U);
  for (const auto& seen : web.seen()) EXPECT_FALSE(seen.cellularAllowed);
}

TEST_F(LASDUpdaterTest, ASecondCheckFindsNothingToDo) {
  serveAll("1.0");
  check(kAll);
  const auto first = notifications();
  log.clear();
  check(kAll);
  auto expected = first;
  expected.emplace_back("NoUpdateRequired");
  EXPECT_EQ(notifications(), expected);
  EXPECT_EQ(fetched().size(), 7U) << "the manifest only";
  EXPECT_TRUE(logged(error("No update required for any databases")));
  EXPECT_TRUE(logged(info("gsm version 1.0 matches server version")));
}

TEST_F(LASDUpdaterTest, HowEachTypesLastCheckWentIsKept) {
  using Outcome = LASDUpdater::LastCheck::Outcome;
  const auto outcomes = [this] {
    std::vector<std::pair<std::int32_t, Outcome>> result;
    for (const auto& each : updater->lastChecks()) result.emplace_back(each.type, each.outcome);
    return result;
  };
  using Outcomes = std::vector<std::pair<std::int32_t, Outcome>>;
  EXPECT_TRUE(outcomes().empty());
  // One that is new, one that is not, one that cannot be had, one without a URL, one that the server does not
  // know.
  serveGzip(urlOf("gsm"), "gsm 2");
  web.fail(urlOf("umts"), WebErrorKind::cellularNotAllowed);
  serveManifest({{"gsm", record("2", urlOf("gsm"))},
                 {"umts", record("2", urlOf("umts"))},
                 {"cdma", record("1", urlOf("cdma"))},
                 {"lte", versionOnly("1")}});
  setLocal("cdma", versionOnly("1"));
  check(kAll);
  EXPECT_EQ(outcomes(), (Outcomes{{gsm, Outcome::updated},
                                  {umts, Outcome::failed},
                                  {cdma, Outcome::noUpdateRequired},
                                  {lte, Outcome::failed},
                                  {scdma, Outcome::noUpdateRequired}}));
}

TEST_F(LASDUpdaterTest, ACheckThatIsUnderWayIsToldAndOneWithoutAManifestHasFailed) {
  using Outcome = LASDUpdater::LastCheck::Outcome;
  web.fail(kManifest, WebErrorKind::cellularNotAllowed);
  updater->checkForUpdate(server, lte);
  EXPECT_TRUE(updater->lastChecks().empty()) << "it has not begun";
  web.holdAnswers();
  std::thread checking([&] { queues.updater->runReady(); });
  while (web.seen().empty()) std::this_thread::yield();
  ASSERT_EQ(updater->lastChecks().size(), 1U);
  EXPECT_EQ(updater->lastChecks()[0].type, lte);
  EXPECT_EQ(updater->lastChecks()[0].outcome, Outcome::checking);
  web.releaseAnswers();
  checking.join();
  ASSERT_EQ(updater->lastChecks().size(), 1U);
  EXPECT_EQ(updater->lastChecks()[0].outcome, Outcome::failed);
  web.answer(kManifest, 200, "no manifest");
  check(lte);
  EXPECT_EQ(updater->lastChecks()[0].outcome, Outcome::failed);
}

TEST_F(LASDUpdaterTest, AShutDownEndsTheQueueAndACheckThatHasNotBegunNeverRuns) {
  serveAll("1.0");
  updater->checkForUpdate(server, lte);
  const std::weak_ptr<ManualWorkQueue> queue = std::exchange(queues.updater, nullptr);
  ASSERT_FALSE(queue.expired());
  updater->shutDown();
  EXPECT_TRUE(queue.expired());
  EXPECT_TRUE(web.seen().empty());
  EXPECT_TRUE(updater->lastChecks().empty());
}

TEST_F(LASDUpdaterTest, BitsOfNoTypeAreNotChecked) {
  serveManifest({});
  check(~std::uint32_t{0});
  EXPECT_EQ(updater->lastChecks().size(), 5U);
  for (const auto& each : updater->lastChecks()) {
    EXPECT_NE(each.type, 0);
    EXPECT_EQ(static_cast<std::uint32_t>(each.type) & ~kAll, 0U);
  }
  check(~kAll);
  EXPECT_EQ(updater->lastChecks().size(), 5U);
}

TEST_F(LASDUpdaterTest, TheWholeOfACheckIsLoggedInOrder) {
  serveManifest({{"gsm", record("2", urlOf("gsm"))}, {"umts", record("1", urlOf("umts"))}});
  setLocal("umts", versionOnly("1"));
  web.fail(urlOf("gsm"), WebErrorKind::cellularNotAllowed);
  check(gsm | umts | lte);
  const auto manifestSize =
      serializePropertyList(PropertyList::dictionary(
                                {{"gsm", record("2", urlOf("gsm"))}, {"umts", record("1", urlOf("umts"))}}),
                            PropertyListFormat::xml)
          ->size();
  EXPECT_EQ(
      log.entries(),
      (Lines{info("Trying to see if update available for mask d"),
             info("Reading local resource com.norvale.lasd"), info("Fetching URL " + kManifest),
             info("URL retrieved " + kManifest + ", size: " + std::to_string(manifestSize) + " "),
             info("umts version 1 matches server version"),
             info("lte db is not present locally, update required"),
             info("We have don't have a previously downloaded gsm database, server has 2, update required"),
             info("Fetching URL " + urlOf("gsm")),
             error("HTTP request failed for URL " + urlOf("gsm") +
                   " with error cellular access not allowed errorcode 0 (no status)"),
             error("Cannot download file " + urlOf("gsm") +
                   ". Either Wifi is turned OFF or not Wifi attached")}));
  EXPECT_EQ(notifications(), std::vector<std::string>{"UpdateFailed"});
}

TEST_F(LASDUpdaterTest, TheRequestReturnsAtOnceAndTheWorkIsDoneOnTheUpdatersQueue) {
  serveAll("1.0");
  EXPECT_EQ(queues.updater, nullptr) << "nothing is made before it is needed";
  updater->checkForUpdate(server, 0xABCDEF);
  EXPECT_EQ(log.entries(), Lines{info("Trying to see if update available for mask abcdef")});
  ASSERT_NE(queues.updater, nullptr);
  EXPECT_EQ(queues.updater->label(), "LASDUpdater");
  EXPECT_EQ(server.busyMask(), 1U);
  EXPECT_TRUE(web.seen().empty());
  queues.updater->runReady();
  EXPECT_EQ(server.busyMask(), 0U);
  EXPECT_TRUE(server.isCountingDown()) << "no client and no token: the countdown begins";
}

TEST_F(LASDUpdaterTest, ACheckThatFindsNoQueueLeavesNoTokenBehind) {
  queues.refuseQueues = true;
  EXPECT_THROW(updater->checkForUpdate(server, 1), std::bad_alloc);
  EXPECT_EQ(server.busyMask(), 0U);
}

// Takes no memory, which the check must have for itself, and remembers whether it was given up.
class ShortLog final : public LogSink {
 public:
  ShortLog() : previous_(setLogSink(this)) {}
  ShortLog(const ShortLog&) = delete;
  ShortLog& operator=(const ShortLog&) = delete;
  ~ShortLog() override { setLogSink(previous_); }
  void unified(LogLevel, std::string_view line, const LogPlace&, const MessageId&) noexcept override {
    if (line == "Update check given up: out of memory") isGivenUp = true;
  }
  void bsd(SyslogPriority, std::string_view, const MessageId&) noexcept override {}

  std::atomic<bool> isGivenUp = false;

 private:
  LogSink* const previous_;
};

TEST_F(LASDUpdaterTest, AManifestThatCannotBeReadForLackOfMemoryIsNotTakenForNothingToDo) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "nothing fails under this sanitizer";
  serveAll("1.0");
  bool anyFailed = true;
  int givenUp = 0;
  for (long number = 0; anyFailed; ++number) {
    ASSERT_LT(number, 10'000);
    const std::size_t before = notifications().size();
    updater->checkForUpdate(server, 0);
    const ShortLog shortLog;
    {
      const FailingAllocations failing(number, FailingAllocations::HowMany::one);
      queues.updater->runReady();
      anyFailed = FailingAllocations::failures() > 0;
    }
    EXPECT_EQ(server.busyMask(), 0U) << number;
    if (shortLog.isGivenUp) {
      ++givenUp;
      ASSERT_EQ(notifications().size(), before + 1) << number;
      EXPECT_EQ(notifications().back(), "UpdateFailed") << number;
    }
  }
  EXPECT_GT(givenUp, 10) << "five databases of several texts each";
  EXPECT_EQ(notifications().back(), "NoUpdateRequired");
}

TEST_F(LASDUpdaterTest, RecordsThatCannotBeReadForLackOfMemoryFailTheirDatabases) {
  serveAll("1.0");
  preferences.operationsWithMemory = 0;
  check(gsm | umts);
  EXPECT_EQ(notifications(), (std::vector<std::string>{"UpdateFailed", "UpdateFailed"}));
  EXPECT_TRUE(logged(error("Update of the gsm database given up: out of memory")));
  EXPECT_TRUE(logged(error("Update of the umts database given up: out of memory")));
  EXPECT_FALSE(logged(error("No update required for any databases")));
  EXPECT_EQ(fetched(), std::vector<std::string>{kManifest});
  preferences.operationsWithMemory = -1;
  check(gsm | umts);
  ASSERT_EQ(notifications().size(), 4U);
  EXPECT_EQ(notifications().back(), "UpdateAvailable umts");
}

TEST_F(LASDUpdaterTest, ADatabaseWithoutAQueueToFetchWithDoesNotEndTheCheck) {
  serveAll("1.0");
  queues.made.clear();
  queues.refuseQueueAfter = 3;  // after the updater's own and the manifest's
  check(gsm | lte);
  EXPECT_EQ(notifications(), (std::vector<std::string>{"UpdateFailed", "UpdateAvailable lte"}));
  EXPECT_TRUE(logged(error("Update of the gsm database given up: out of memory")));
  EXPECT_EQ(server.busyMask(), 0U);
}

TEST_F(LASDUpdaterTest, OfTheManifestOnlyTheEntryIsKept) {
  const PropertyList manifest = *[] {
    const std::string bytes = *serializePropertyList(
        PropertyList::dictionary({{"lte", record("2", urlOf("lte"))},
                                  {"filler", PropertyList::string(std::string(1'000'000, 'f'))}}),
        PropertyListFormat::binary);
    return std::make_unique<PropertyList>(parsePropertyList(std::as_bytes(std::span(bytes))));
  }();
  serveGzip(urlOf("lte"), "x");
  updater->loadVersions("com.norvale.lasd", LASDUpdater::VersionSource::preferences, lte);
  ASSERT_EQ(updater->compareWithManifest(manifest, lte), lte);
  updater->updateDatabase(lte);
  const PropertyList kept = local("lte");
  EXPECT_EQ(kept, record("2", urlOf("lte")));
  // What is kept as it came lies in the manifest's own memory.
  EXPECT_NE(kept.find("Version").asString().value().data(),
            manifest.find("lte").find("Version").asString().value().data());
}

TEST_F(LASDUpdaterTest, AManifestMayHave16MiBAndADatabaseWhatTheClientTakes) {
  serveAll("1.0");
  check(gsm);
  ASSERT_EQ(web.seen().size(), 2U);
  EXPECT_EQ(web.seen()[0].largestBody, std::uint64_t{16} << 20);
  EXPECT_EQ(web.seen()[1].largestBody, kLargestWebBody);
}

TEST_F(LASDUpdaterTest, Mask0ReadsNoPreferenceAndStillFetchesTheManifest) {
  serveAll("1.0");
  check(0);
  EXPECT_EQ(fetched(), std::vector<std::string>{kManifest});
  EXPECT_EQ(notifications(), std::vector<std::string>{"NoUpdateRequired"});
  EXPECT_TRUE(logged(error("No update required for any databases")));
}

TEST_F(LASDUpdaterTest, MaskBitsOutsideTheFiveAreIgnored) {
  serveAll("1.0");
  check(0xFFFFFFE0);
  EXPECT_EQ(fetched(), std::vector<std::string>{kManifest});
  EXPECT_EQ(notifications(), std::vector<std::string>{"NoUpdateRequired"});
  check(0xFFFFFFE0 | cdma);
  EXPECT_EQ(notifications(), (std::vector<std::string>{"NoUpdateRequired", "UpdateAvailable cdma"}));
}

TEST_F(LASDUpdaterTest, AManifestThatCannotBeFetchedYieldsExactlyOneUpdateFailedWithoutADatabase) {
  web.fail(kManifest, WebErrorKind::hostNotFound);
  check(kAll);
  EXPECT_EQ(notifications(), std::vector<std::string>{"UpdateFailed"});
  EXPECT_TRUE(logged(error("Could not fetch data from source " + kManifest)));
  EXPECT_EQ(server.busyMask(), 0U);
}

TEST_F(LASDUpdaterTest, AnEmptyManifestIsAFailedFetch) {
  web.answer(kManifest, 200, "");
  check(kAll);
  EXPECT_EQ(notifications(), std::vector<std::string>{"UpdateFailed"});
}

TEST_F(LASDUpdaterTest, AManifestThatIsNoDictionaryMeansThatThereIsNothingToDo) {
  const std::string array =
      *serializePropertyList(PropertyList::array({PropertyList::string("gsm")}), PropertyListFormat::xml);
  for (const std::string& body :
       {std::string("<html>log in</html>"), std::string("bplist00garbage"), array}) {
    log.clear();
    web.answer(kManifest, 200, body);
    check(kAll);
    EXPECT_EQ(notifications().back(), "NoUpdateRequired");
    const auto lines = log.entries();
    ASSERT_GE(lines.size(), 2U);
    EXPECT_EQ(lines[lines.size() - 2], error("Could not create version dictionary from downloaded plist!"));
    EXPECT_EQ(lines.back(), error("No update required for any databases"));
  }
  EXPECT_EQ(notifications().size(), 3U);
}

TEST_F(LASDUpdaterTest, ABinaryManifestIsReadToo) {
  serveGzip(urlOf("lte"), "x");
  serveManifest({{"lte", record("1", urlOf("lte"))}}, PropertyListFormat::binary);
  check(kAll);
  EXPECT_EQ(notifications(), std::vector<std::string>{"UpdateAvailable lte"});
}

TEST_F(LASDUpdaterTest, FailuresOfSingleDatabasesDoNotStopTheOthers) {
  serveAll("1.0");
  web.fail(urlOf("gsm"), WebErrorKind::timedOut);
  web.answer(urlOf("cdma"), 200, "not gzip", {{"Content-Type", "application/gzip"}});
  web.answer(urlOf("scdma"), 200, gzipOf("x"), {{"Content-Type", "text/html"}});
  check(kAll);
  EXPECT_EQ(notifications(), (std::vector<std::string>{"UpdateFailed", "UpdateAvailable umts", "UpdateFailed",
                                                       "UpdateAvailable lte", "UpdateFailed"}));
  EXPECT_FALSE(local("gsm"));
  EXPECT_TRUE(local("umts"));
  log.clear();
  serveAll("1.0");
  check(kAll);
  EXPECT_EQ(fetched().size(), 6U + 4U) << "the next check repairs the three";
  EXPECT_EQ(local("gsm"), record("1.0", urlOf("gsm")));
}

TEST_F(LASDUpdaterTest, AnUpdateWithoutAUrlTellsNobody) {
  serveManifest({{"gsm", versionOnly("2")},
                 {"umts", record("2", "")},
                 {"lte", PropertyList::dictionary({{"Version", PropertyList::string("2")},
                                                   {"ContentURL", PropertyList::integer(1)}})}});
  check(kAll);
  EXPECT_TRUE(notifications().empty());
  EXPECT_TRUE(logged(error("Could not find gsm database URL")));
  EXPECT_TRUE(logged(error("URL for umts database is empty")));
  EXPECT_TRUE(logged(error("Could not find lte database URL")));
  EXPECT_EQ(fetched(), std::vector<std::string>{kManifest});
  EXPECT_EQ(server.busyMask(), 0U);
}

TEST_F(LASDUpdaterTest, UpdatingATypeThatWasNeverLookedAtFindsNoUrl) {
  updater->updateDatabase(gsm);
  updater->updateDatabase(3);
  EXPECT_EQ(log.entries(),
            (Lines{error("Could not find gsm database URL"), error("Could not find unknown database URL")}));
  EXPECT_TRUE(notifications().empty());
}

TEST_F(LASDUpdaterTest, TypesMissingInTheManifestOrNoDictionariesThereAreSkipped) {
  serveGzip(urlOf("cdma"), "x");
  serveManifest({{"cdma", record("1", urlOf("cdma"))}, {"gsm", PropertyList::string("2.0")}});
  check(gsm | cdma | lte);
  EXPECT_EQ(notifications(), std::vector<std::string>{"UpdateAvailable cdma"});
  EXPECT_TRUE(logged(info("gsm db is not present locally, update required")));
  EXPECT_TRUE(logged(info("lte db is not present locally, update required")));
}

TEST_F(LASDUpdaterTest, WithTheTelephonyDaemonAbsentACheckCompletesNormally) {
  messagePorts.nobodyListens = true;
  serveAll("1.0");
  check(kAll);
  EXPECT_TRUE(local("scdma"));
  EXPECT_EQ(server.busyMask(), 0U);
}

TEST_F(LASDUpdaterTest, ServerEntriesOfAnEarlierCheckAreReplacedBeforeUse) {
  serveManifest({{"gsm", record("2", urlOf("gsm"))}});
  web.fail(urlOf("gsm"), WebErrorKind::timedOut);
  check(gsm);
  EXPECT_EQ(notifications(), std::vector<std::string>{"UpdateFailed"});
  serveGzip(urlOf("gsm"), "x");
  check(gsm);
  EXPECT_EQ(notifications(), (std::vector<std::string>{"UpdateFailed", "UpdateAvailable gsm"}))
      << "what counts is the record in the preferences, not what was seen of the server";
}

TEST_F(LASDUpdaterTest, ARecordThatAnotherProcessRemovedOrReplacedMeanwhileDecidesTheNextCheck) {
  serveAll("1.0");
  check(gsm);
  ASSERT_TRUE(local("gsm"));
  InMemoryPreferences another(preferences.disk());
  const auto store = [&another](const PropertyList& value) {
    another.setValue("gsm", value, "com.norvale.lasd", UserScope::currentUser, HostScope::anyHost);
    return bool{another.synchronize("com.norvale.lasd", UserScope::currentUser, HostScope::anyHost)};
  };
  ASSERT_TRUE(store({}));
  check(gsm);
  ASSERT_TRUE(store(versionOnly("0.9")));
  check(gsm);
  EXPECT_EQ(notifications(), std::vector<std::string>(3, "UpdateAvailable gsm"));
  EXPECT_TRUE(logged(info("We have gsm version 0.9, server has 1.0, update required")));
}

TEST_F(LASDUpdaterTest, AStalledDownloadHoldsTheProcessWithoutAnyClient) {
  serveAll("1.0");
  updater->checkForUpdate(server, gsm);
  web.holdAnswers();
  std::thread checking([&] { queues.updater->runReady(); });
  while (web.seen().empty()) std::this_thread::yield();
  EXPECT_EQ(server.busyMask(), 1U);
  EXPECT_FALSE(server.isCountingDown());
  web.releaseAnswers();
  checking.join();
  EXPECT_EQ(server.busyMask(), 0U);
  EXPECT_TRUE(server.isCountingDown());
}

TEST_F(LASDUpdaterTest, EachInstallHasABusyTokenOfItsOwn) {
  // Seen by the message that follows each install.
  class Watching final : public MessagePorts {
   public:
    explicit Watching(ServerContext& context) : server_(context) {}
    std::unique_ptr<RemoteMessagePort> openRemote(const std::string&) noexcept override {
      masks.push_back(server_.busyMask());
      return nullptr;
    }
    std::vector<std::uint32_t> masks;

   private:
    ServerContext& server_;
  } watching(server);
  updater->configure({queues, web, gunzip, preferences, watching, kManifest, directory, roomyDisk});
  serveAll("1.0");
  check(gsm | lte);
  EXPECT_EQ(watching.masks, (std::vector<std::uint32_t>{3, 3}));
  check(gsm | lte);
  EXPECT_EQ(watching.masks, (std::vector<std::uint32_t>{3, 3, 1}));
}

TEST_F(LASDUpdaterTest, WithoutMemoryForARequestOrAQueueACheckFailsAndGivesItsTokensBack) {
  serveAll("1.0");
  web.exhausted = true;
  check(kAll);
  EXPECT_EQ(notifications(), std::vector<std::string>{"UpdateFailed"});
  EXPECT_TRUE(logged(error("Cannot create HTTP request for URL " + kManifest)));
  EXPECT_EQ(server.busyMask(), 0U);
  web.exhausted = false;
  log.clear();
  queues.refuseQueues = true;
  check(kAll);
  EXPECT_TRUE(logged(error("Update check given up: out of memory")));
  EXPECT_EQ(notifications(), (std::vector<std::string>{"UpdateFailed", "UpdateFailed"}));
  EXPECT_EQ(server.busyMask(), 0U);
  queues.refuseQueues = false;
  check(gsm);
  EXPECT_EQ(notifications().back(), "UpdateAvailable gsm");
}

TEST_F(LASDUpdaterTest, ChecksRunOneAfterTheOther) {
  serveAll("1.0");
  updater->checkForUpdate(server, gsm);
  updater->checkForUpdate(server, gsm | umts);
  EXPECT_EQ(server.busyMask(), 3U);
  queues.updater->runReady();
  EXPECT_EQ(notifications(), (std::vector<std::string>{"UpdateAvailable gsm", "UpdateAvailable umts"}));
}

TEST_F(LASDUpdaterTest, ACheckHoldsTheUpdater) {
  serveAll("1.0");
  updater->checkForUpdate(server, gsm);
  const std::weak_ptr<LASDUpdater> weak = updater;
  updater = std::make_shared<LASDUpdater>();
  EXPECT_FALSE(weak.expired());
  queues.updater->runReady();
  EXPECT_TRUE(weak.expired());
  EXPECT_EQ(notifications(), std::vector<std::string>{"UpdateAvailable gsm"});
}

TEST_F(LASDUpdaterTest, AnUpdaterThatNobodyHoldsEndsTheProcess) {
  testing::FLAGS_gtest_death_test_style = "threadsafe";
  EXPECT_DEATH(
      {
        LASDUpdater unowned;
        unowned.configure({queues, web, gunzip, preferences, messagePorts, kManifest, directory, roomyDisk});
        unowned.checkForUpdate(server, gsm);
      },
      "");
}

TEST_F(LASDUpdaterTest, TheProcessHasOneWhoseManifestIsOnTheUpdateServerOverHttps) {
  ASSERT_NE(LASDUpdater::shared(), nullptr);
  EXPECT_EQ(LASDUpdater::shared(), LASDUpdater::shared());
  const std::string url = kManifestUrl;
  EXPECT_TRUE(url.starts_with("https://"));
  EXPECT_TRUE(url.ends_with("/1/v3/lasd.plist"));
}

// ---- versions ----

TEST_F(LASDUpdaterTest, VersionsThatSayTheSameAreUpToDate) {
  const std::pair<const char*, const char*> same[] = {
      {"1", "1"}, {"2.0", "2.00"}, {"ABC", "abc"}, {"r007", "R7"}};
  for (const auto& [here, there] : same) {
    EXPECT_EQ(judge(versionOnly(here), versionOnly(there)),
              std::make_pair(true, std::string("lte version ") + here + " matches server version"));
  }
}

TEST_F(LASDUpdaterTest, AnyDifferenceIsAnUpdateOlderServersIncluded) {
  const std::pair<const char*, const char*> different[] = {
      {"1", "2"}, {"2", "1"}, {"1.10", "1.9"}, {"1", "1.0"}, {"", "1"}};
  for (const auto& [here, there] : different) {
    EXPECT_EQ(judge(versionOnly(here), versionOnly(there)),
              std::make_pair(false, std::string("We have lte version ") + here + ", server has " + there +
                                        ", update required"));
  }
}

TEST_F(LASDUpdaterTest, WithoutARecordOrItsVersionWeHaveNoDatabase) {
  const auto expected = [](const char* there) {
    return std::make_pair(
        false, std::string("We have don't have a previously downloaded lte database, server has ") + there +
                   ", update required");
  };
  const PropertyList noVersion = PropertyList::dictionary({{"ContentURL", PropertyList::string("x")}});
  const PropertyList numberVersion = PropertyList::dictionary({{"Version", PropertyList::integer(2)}});
  EXPECT_EQ(judge(PropertyList(), versionOnly("2")), expected("2"));
  EXPECT_EQ(judge(PropertyList::string("2"), versionOnly("2")), expected("2")) << "no dictionary, no record";
  EXPECT_EQ(judge(PropertyList(), noVersion), expected("(null)"));
  EXPECT_EQ(judge(noVersion, versionOnly("2")), expected("2"));
  EXPECT_EQ(judge(numberVersion, versionOnly("2")), expected("2"));
}

TEST_F(LASDUpdaterTest, AServerEntryWithoutVersionIsAlwaysAnUpdate) {
  const PropertyList noVersion = PropertyList::dictionary({{"ContentURL", PropertyList::string("x")}});
  EXPECT_EQ(judge(versionOnly("1"), noVersion),
            std::make_pair(false, std::string("We have lte version 1, server has (null), update required")));
  EXPECT_EQ(
      judge(noVersion, noVersion),
      std::make_pair(false, std::string("We have lte version (null), server has (null), update required")));
}

TEST_F(LASDUpdaterTest, WithoutAServerEntryTheLineSpeaksOfTheLocalSide) {
  EXPECT_EQ(judge(versionOnly("1"), PropertyList()),
            std::make_pair(false, std::string("lte db is not present locally, update required")));
  EXPECT_EQ(judge(versionOnly("1"), PropertyList::string("1")),
            std::make_pair(false, std::string("lte db is not present locally, update required")));
}

TEST_F(LASDUpdaterTest, WithoutAManifestNothingIsUpToDateAndNothingIsLogged) {
  EXPECT_FALSE(updater->isUpToDate(PropertyList(), gsm));
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(LASDUpdaterTest, ATypeWithoutNameIsUnknownInTheLines) {
  const PropertyList manifest = PropertyList::dictionary({{"unknown", versionOnly("9")}});
  EXPECT_FALSE(updater->isUpToDate(manifest, 3));
  EXPECT_EQ(log.entries(),
            Lines{info("We have don't have a previously downloaded unknown database, server has 9, "
                       "update required")});
}

TEST_F(LASDUpdaterTest, LoadingFromThePreferencesGives0AndOverwritesEarlierEntries) {
  setLocal("gsm", versionOnly("1"));
  EXPECT_EQ(updater->loadVersions("com.norvale.lasd", LASDUpdater::VersionSource::preferences, gsm), 0);
  const PropertyList manifest = PropertyList::dictionary({{"gsm", versionOnly("1")}});
  EXPECT_TRUE(updater->isUpToDate(manifest, gsm));
  setLocal("gsm", PropertyList());
  EXPECT_EQ(updater->loadVersions("com.norvale.lasd", LASDUpdater::VersionSource::preferences, gsm), 0);
  EXPECT_FALSE(updater->isUpToDate(manifest, gsm));
}

TEST_F(LASDUpdaterTest, LoadingFromTheManifestGivesTheMaskOfWhatIsNew) {
  serveAll("1.0");
  const auto load = [&](std::uint32_t mask) {
    return updater->loadVersions(kManifest, LASDUpdater::VersionSource::manifest, mask);
  };
  EXPECT_EQ(load(kAll), 0) << "no entries yet";
  updater->loadVersions("com.norvale.lasd", LASDUpdater::VersionSource::preferences, kAll);
  EXPECT_EQ(load(gsm | lte), gsm | lte);
  EXPECT_EQ(load(gsm | lte | umts), umts) << "the first two hold the server's entries by now";
  web.fail(kManifest, WebErrorKind::cancelled);
  EXPECT_EQ(load(kAll), 0xFFFFFFFF);
}

}  // namespace
}  // namespace brenvik
