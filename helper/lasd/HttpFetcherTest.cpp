// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/lasd/HttpFetcher.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <atomic>
#include <csignal>
#include <future>
#include <thread>

#include "helper/lasd/LasdTestSupport.h"
#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

constexpr const char kUrl[] = "https://server.example/file";

class HttpFetcherTest : public LasdTest {
 protected:
  std::string path() const { return folder / "output"; }
  std::string textOf(const HttpFetcher& fetcher) {
    const auto bytes = fetcher.bodyAsData();
    return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
  }
  // A fetcher that has this body, served with these headers.
  std::unique_ptr<HttpFetcher> fetched(const std::string& body, HeaderMap headers,
                                       std::function<DiskSpace(int)> diskSpace = roomyDisk) {
    web.answer(kUrl, 200, body, std::move(headers));
    auto fetcher = std::make_unique<HttpFetcher>(fetcherParts(std::move(diskSpace)));
    EXPECT_TRUE(fetcher->fetch(kUrl, WifiOnly::yes));
    log.clear();
    return fetcher;
  }
  const HeaderMap gzipType{{"Content-Type", "application/gzip"}};
};

// ---- fetch ----

TEST_F(HttpFetcherTest, ABodyIsFetchedAndLoggedOnAUtilityQueueOfItsOwn) {
  web.answer(kUrl, 200, "body");
  HttpFetcher fetcher(fetcherParts());
  EXPECT_EQ(queues.made, (std::vector<std::pair<std::string, QualityOfService>>{
                             {"com.norvale.httpdownloadqueue", QualityOfService::utility}}));
  EXPECT_TRUE(fetcher.fetch(kUrl, WifiOnly::yes));
  EXPECT_EQ(textOf(fetcher), "body");
  EXPECT_EQ(log.entries(), (Lines{info("Fetching URL https://server.example/file"),
                                  info("URL retrieved https://server.example/file, size: 4 ")}));
  ASSERT_EQ(web.seen().size(), 1U);
  const auto seen = web.seen()[0];
  EXPECT_EQ(seen.type, WebRequestType::get);
  EXPECT_EQ(seen.url, kUrl);
  EXPECT_EQ(seen.headers, (HeaderMap{{"Accept-Encoding", "gzip"}}));
  EXPECT_FALSE(seen.cellularAllowed);
  EXPECT_EQ(seen.queueLabel, "com.norvale.httpdownloadqueue");
  EXPECT_EQ(seen.bodySize, 0U);
  EXPECT_EQ(seen.timeLimit.count(), 0) << "no limit beside the client's own";
  EXPECT_EQ(seen.largestBody, kLargestWebBody);
}

TEST_F(HttpFetcherTest, CellularStaysAllowedUnlessTheFetchIsWifiOnly) {
  web.answer(kUrl, 200, "body");
  HttpFetcher fetcher(fetcherParts());
  EXPECT_TRUE(fetcher.fetch(kUrl, WifiOnly::no));
  EXPECT_TRUE(web.seen().at(0).cellularAllowed);
}

TEST_F(HttpFetcherTest, AnEmptyUrlFailsAtOnceAndMakesNoRequest) {
  HttpFetcher fetcher(fetcherParts());
  EXPECT_FALSE(fetcher.fetch("", WifiOnly::yes));
  EXPECT_EQ(log.entries(), Lines{error("URL is empty")});
  EXPECT_TRUE(web.seen().empty());
}

TEST_F(HttpFetcherTest, AUrlThatNoRequestCanBeMadeOfFails) {
  web.refuse("nonsense");
  HttpFetcher fetcher(fetcherParts());
  EXPECT_FALSE(fetcher.fetch("nonsense", WifiOnly::yes));
  EXPECT_EQ(log.entries(),
            (Lines{info("Fetching URL nonsense"), error("Cannot create HTTP request for URL nonsense")}));
}

TEST_F(HttpFetcherTest, EveryStatusOtherThan200FailsAndIsNamed) {
  for (const auto& [status, text] :
       std::vector<std::pair<int, std::string>>{{304, "Not Modified"},
                                                {404, "Not Found"},
                                                {201, "Created"},
                                                {206, "Partial Content"},
                                                {500, "Internal Server Error"}}) {
    log.clear();
    web.answer(kUrl, status, "a body all the same");
    HttpFetcher fetcher(fetcherParts());
    EXPECT_FALSE(fetcher.fetch(kUrl, WifiOnly::yes));
    EXPECT_EQ(textOf(fetcher), "");
    EXPECT_EQ(
        log.entries(),
        (Lines{
            info("Fetching URL https://server.example/file"),
            error("HTTP request failed for URL https://server.example/file with error no error errorcode " +
                  std::to_string(status) + " (" + text + ")")}));
  }
}

TEST_F(HttpFetcherTest, AFailedTransferIsNamed) {
  web.fail(kUrl, WebErrorKind::certificateClock);
  HttpFetcher fetcher(fetcherParts());
  EXPECT_FALSE(fetcher.fetch(kUrl, WifiOnly::yes));
  EXPECT_EQ(log.entries().back(), error("HTTP request failed for URL https://server.example/file with error "
                                        "server certificate not valid at "
                                        "this time, check the system clock errorcode 0 (no status)"));
}

TEST_F(HttpFetcherTest, A200ThatDidNotArriveWholeFails) {
  WebResponse response;
  response.errorKind = WebErrorKind::connectionLost;
  response.statusCode = 200;
  response.body.append(std::as_bytes(std::span("0123456789", 10)));
  web.answer(kUrl, response);
  HttpFetcher fetcher(fetcherParts());
  EXPECT_FALSE(fetcher.fetch(kUrl, WifiOnly::yes));
  EXPECT_TRUE(fetcher.bodyAsData().empty());
}

TEST_F(HttpFetcherTest, A200ResponseWithAnEmptyBodyFailsWithoutAFailureLine) {
  web.answer(kUrl, 200, "");
  HttpFetcher fetcher(fetcherParts());
  EXPECT_FALSE(fetcher.fetch(kUrl, WifiOnly::yes));
  EXPECT_EQ(log.entries(), (Lines{info("Fetching URL https://server.example/file"),
                                  info("URL retrieved https://server.example/file, size: 0 ")}));
}

TEST_F(HttpFetcherTest, NoResponseAtAllFails) {
  web.answerNothing(kUrl);
  HttpFetcher fetcher(fetcherParts());
  EXPECT_FALSE(fetcher.fetch(kUrl, WifiOnly::yes));
  EXPECT_EQ(log.entries(), (Lines{info("Fetching URL https://server.example/file"),
                                  error("Did not receive HTTP response!")}));
}

TEST_F(HttpFetcherTest, FetchBlocksUntilTheClientReports) {
  web.answer(kUrl, 200, "late");
  web.holdAnswers();
  HttpFetcher fetcher(fetcherParts());
  std::atomic<bool> returned{false};
  std::thread waiting([&] {
    EXPECT_TRUE(fetcher.fetch(kUrl, WifiOnly::yes));
    returned = true;
  });
  while (web.seen().empty()) std::this_thread::yield();
  EXPECT_FALSE(returned);
  web.releaseAnswers();
  waiting.join();
  EXPECT_EQ(textOf(fetcher), "late");
}

TEST_F(HttpFetcherTest, OnItsOwnQueueAFetchFailsAtOnce) {
  // As where no queue can be had but the main one: the completion would wait for the fetch, and it for that.
  class OneQueue final : public WorkQueues {
   public:
    explicit OneQueue(WorkQueues& real) : real_(real), queue(real.makeSerial("one", {})) {}
    WorkQueue& main() noexcept override { return real_.main(); }
    WorkQueue& global() noexcept override { return real_.global(); }
    std::shared_ptr<WorkQueue> makeSerial(std::string, QualityOfService) override { return queue; }
    std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t, std::uint32_t, WorkQueue::Task,
                                                             WorkQueue::Task) override {
      return nullptr;
    }

   private:
    WorkQueues& real_;

   public:
    const std::shared_ptr<WorkQueue> queue;
  } one(queues);
  web.answer(kUrl, 200, "body");
  std::promise<bool> result;
  one.queue->post([&] {
    HttpFetcher fetcher({one, web, gunzip, roomyDisk});
    result.set_value(fetcher.fetch(kUrl, WifiOnly::yes));
  });
  EXPECT_FALSE(result.get_future().get());
  EXPECT_EQ(log.entries().back(), error(std::string("Cannot create HTTP request for URL ") + kUrl));
  EXPECT_TRUE(web.seen().empty());
}

TEST_F(HttpFetcherTest, WithoutMemoryForARequestAFetchFails) {
  web.exhausted = true;
  HttpFetcher fetcher(fetcherParts());
  EXPECT_FALSE(fetcher.fetch(kUrl, WifiOnly::yes));
  EXPECT_EQ(log.entries().back(), error(std::string("Cannot create HTTP request for URL ") + kUrl));
}

TEST_F(HttpFetcherTest, ASecondFetchClearsWhatTheFirstBrought) {
  const auto fetcher = fetched(gzipOf("x"), gzipType);
  web.answer("https://server.example/gone", 404, "");
  EXPECT_FALSE(fetcher->fetch("https://server.example/gone", WifiOnly::yes));
  EXPECT_TRUE(fetcher->bodyAsData().empty());
  log.clear();
  EXPECT_FALSE(fetcher->uncompressTo(path()));
  EXPECT_EQ(log.entries(), Lines{error("Cannot uncompress downloaded buffer without a response!")});
}

// ---- uncompressTo ----

TEST_F(HttpFetcherTest, AGzipBodyIsWrittenUncompressedAndReplacesWhatWasThere) {
  const std::string content(1'000'000, 'c');
  const auto fetcher = fetched(gzipOf(content), gzipType);
  std::ofstream(path()) << std::string(2'000'000, 'o');
  EXPECT_TRUE(fetcher->uncompressTo(path()));
  EXPECT_TRUE(contentOf(path()) == content);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(HttpFetcherTest, SeveralMembersAreWrittenOneAfterTheOther) {
  const auto fetcher = fetched(gzipOf("one ") + gzipOf("two"), gzipType);
  EXPECT_TRUE(fetcher->uncompressTo(path()));
  EXPECT_EQ(contentOf(path()), "one two");
}

TEST_F(HttpFetcherTest, WithoutAResponseThereIsNothingToUncompress) {
  HttpFetcher fetcher(fetcherParts());
  EXPECT_FALSE(fetcher.uncompressTo(path()));
  EXPECT_EQ(log.entries(), Lines{error("Cannot uncompress downloaded buffer without a response!")});
  EXPECT_FALSE(std::filesystem::exists(path()));
}

TEST_F(HttpFetcherTest, AMissingContentTypeFailsEvenWhenTheBytesAreGzip) {
  const auto fetcher = fetched(gzipOf("content"), {{"Content-Encoding", "gzip"}});
  EXPECT_FALSE(fetcher->uncompressTo(path()));
  EXPECT_EQ(log.entries(), Lines{error("Cannot find Content-Type header in response!")});
  EXPECT_FALSE(std::filesystem::exists(path()));
}

TEST_F(HttpFetcherTest, TheContentTypeMustHoldTheWordGzipInSmallLetters) {
  for (const char* type : {"application/x-gzip", "application/gzip; charset=binary", "gzip", "notgzipped"}) {
    EXPECT_TRUE(fetched(gzipOf("content"), {{"content-type", type}})->uncompressTo(path())) << type;
  }
  for (const std::string type : {"application/GZIP", "application/octet-stream", "Gzip", ""}) {
    const auto fetcher = fetched(gzipOf("content"), {{"Content-Type", type}});
    EXPECT_FALSE(fetcher->uncompressTo(path()));
    EXPECT_EQ(log.entries(),
              Lines{error("Expected to find gzip in Content-Type header, found " + type + " instead")});
  }
}

TEST_F(HttpFetcherTest, AnOutputFileThatCannotBeOpenedFailsWithItsReason) {
  const std::string missing = folder / "missing" / "output";
  auto fetcher = fetched(gzipOf("content"), gzipType);
  EXPECT_FALSE(fetcher->uncompressTo(missing));
  EXPECT_EQ(log.entries(),
            Lines{error("Cannot open output file " + missing + ": No such file or directory")});
  log.clear();
  EXPECT_FALSE(fetcher->uncompressTo(folder));
  EXPECT_EQ(log.entries(), Lines{error("Cannot open output file " + folder.string() + ": Is a directory")});
}

TEST_F(HttpFetcherTest, NothingIsWrittenThroughALinkOrIntoAPipe) {
  const auto fetcher = fetched(gzipOf("content"), gzipType);
  std::ofstream(folder / "precious") << "precious";
  std::filesystem::create_symlink("precious", path());
  EXPECT_FALSE(fetcher->uncompressTo(path()));
  EXPECT_EQ(log.entries(),
            Lines{error("Cannot open output file " + path() + ": Too many levels of symbolic links")});
  EXPECT_EQ(contentOf(folder / "precious"), "precious");
  const std::string pipe = folder / "pipe";
  ASSERT_EQ(::mkfifo(pipe.c_str(), 0600), 0);
  EXPECT_FALSE(fetcher->uncompressTo(pipe));
}

TEST_F(HttpFetcherTest, APipeThatSomebodyReadsIsNoOutputFileAndStays) {
  const auto fetcher = fetched(gzipOf("content"), gzipType);
  ASSERT_EQ(::mkfifo(path().c_str(), 0600), 0);
  const UniqueFd reader(::open(path().c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
  ASSERT_TRUE(reader.isValid());
  EXPECT_FALSE(fetcher->uncompressTo(path()));
  EXPECT_EQ(log.entries(), Lines{error("Cannot open output file " + path() + ": Invalid argument")});
  char c = 0;
  EXPECT_EQ(::read(reader.get(), &c, 1), 0) << "nobody writes";
  EXPECT_TRUE(std::filesystem::is_fifo(path()));
}

TEST_F(HttpFetcherTest, ACorruptGzipBodyLeavesNoFile) {
  const std::string good = gzipOf(std::string(500'000, 'x') + "end");
  std::string wrongChecksum = good;
  wrongChecksum[wrongChecksum.size() - 8] ^= 1;
  for (const std::string& body : {std::string("not gzip"), wrongChecksum, good.substr(0, good.size() - 1),
                                  good.substr(0, good.size() / 2), good + "trailing bytes"}) {
    const auto fetcher = fetched(body, gzipType);
    std::ofstream(path()) << "older";
    EXPECT_FALSE(fetcher->uncompressTo(path()));
    EXPECT_EQ(log.entries(), Lines{error("Could not uncompress HTTP response to " + path() + "!")});
    EXPECT_FALSE(std::filesystem::exists(path()));
  }
}

TEST_F(HttpFetcherTest, APartialFileThatCannotBeRemovedIsTold) {
  // The file is taken away while it is written, so that there is none to remove.
  class Thief final : public Gunzip {
   public:
    explicit Thief(std::string path) : path_(std::move(path)) {}
    GunzipOutcome gunzipInto(const GunzipInput&, int, std::uint64_t, std::uint64_t) noexcept override {
      std::filesystem::remove(path_);
      return {GunzipResult::damaged, 0, 0};
    }

   private:
    const std::string path_;
  } thief(path());
  web.answer(kUrl, 200, "x", gzipType);
  HttpFetcher fetcher({queues, web, thief, roomyDisk});
  ASSERT_TRUE(fetcher.fetch(kUrl, WifiOnly::yes));
  log.clear();
  EXPECT_FALSE(fetcher.uncompressTo(path()));
  EXPECT_EQ(log.entries(), (Lines{error("Could not uncompress HTTP response to " + path() + "!"),
                                  error("Failed to remove partially uncompressed file at " + path() +
                                        ": No such file or directory")}));
}

TEST_F(HttpFetcherTest, AFileOfAnotherSizeThanWasSaidIsNotTaken) {
  class Liar final : public Gunzip {
   public:
    GunzipOutcome gunzipInto(const GunzipInput&, int file, std::uint64_t, std::uint64_t) noexcept override {
      EXPECT_EQ(::write(file, "part", 4), 4);
      return {GunzipResult::whole, 8, 0};
    }
  } liar;
  web.answer(kUrl, 200, "x", gzipType);
  HttpFetcher fetcher({queues, web, liar, roomyDisk});
  ASSERT_TRUE(fetcher.fetch(kUrl, WifiOnly::yes));
  log.clear();
  EXPECT_FALSE(fetcher.uncompressTo(path()));
  EXPECT_EQ(log.entries(), Lines{error("Could not uncompress HTTP response to " + path() + "!")});
  EXPECT_FALSE(std::filesystem::exists(path()));
}

TEST_F(HttpFetcherTest, ALimitOnTheBodyIsTheRequests) {
  web.answer(kUrl, 200, "body");
  HttpFetcher fetcher(fetcherParts());
  EXPECT_TRUE(fetcher.fetch(kUrl, WifiOnly::yes, 1000));
  EXPECT_EQ(web.seen().at(0).largestBody, 1000U);
}

TEST_F(HttpFetcherTest, TheReserveOfASmallDiskIsSmall) {
  EXPECT_EQ(diskReserve(std::uint64_t{1} << 40), std::uint64_t{16} << 20);
  EXPECT_EQ(diskReserve(std::uint64_t{800} << 20), std::uint64_t{16} << 20);
  EXPECT_EQ(diskReserve(std::uint64_t{799} << 20), (std::uint64_t{799} << 20) / 50);
  EXPECT_EQ(diskReserve(8 << 20), (8U << 20) / 50);
  EXPECT_EQ(diskReserve(0), 0U);
}

TEST_F(HttpFetcherTest, TheRealDiskHasASizeAndWhatIsNoFileHasNothing) {
  const UniqueFd file(::open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  const DiskSpace disk = diskSpaceOf(file.get());
  EXPECT_GT(disk.size, 0U);
  EXPECT_LE(disk.available, disk.size);
  EXPECT_EQ(diskSpaceOf(-1).size, 0U);
  EXPECT_EQ(diskSpaceOf(-1).available, 0U);
}

TEST_F(HttpFetcherTest, WhatDoesNotFitBesideTheReserveIsToldWithPathNeedAndRoom) {
  // 50,000 bytes have a reserve of 1,000.
  const auto disk = [](int) { return DiskSpace{50'000, 11'000}; };
  EXPECT_TRUE(fetched(gzipOf(std::string(10'000, 'x')), gzipType, disk)->uncompressTo(path()));
  EXPECT_FALSE(fetched(gzipOf(std::string(10'001, 'x')), gzipType, disk)->uncompressTo(path()));
  EXPECT_EQ(log.entries(), (Lines{error("No room for " + path() +
                                        ": it needs 10001 bytes or more, 10000 are free beyond the reserve"),
                                  error("Could not uncompress HTTP response to " + path() + "!")}));
  EXPECT_FALSE(std::filesystem::exists(path()));
}

TEST_F(HttpFetcherTest, ADiskWithoutRoomBesideTheReserveTakesNothing) {
  const auto disk = [](int) { return DiskSpace{50'000, 999}; };
  EXPECT_FALSE(fetched(gzipOf("x"), gzipType, disk)->uncompressTo(path()));
  EXPECT_EQ(log.entries().at(0).line,
            "No room for " + path() + ": it needs 1 bytes or more, 0 are free beyond the reserve");
}

TEST_F(HttpFetcherTest, OfADamagedFileThatDoesNotFitNoNeedIsTold) {
  const auto disk = [](int) { return DiskSpace{50'000, 11'000}; };
  std::string damaged = gzipOf(std::string(100'000, 'x'));
  damaged[damaged.size() - 8] ^= 1;
  EXPECT_FALSE(fetched(damaged, gzipType, disk)->uncompressTo(path()));
  EXPECT_EQ(log.entries(), Lines{error("Could not uncompress HTTP response to " + path() + "!")});
  EXPECT_FALSE(std::filesystem::exists(path()));
}

TEST_F(HttpFetcherTest, AWriteThatFailsIsToldWithItsReason) {
  const auto fetcher = fetched(gzipOf(std::string(100'000, 'x')), gzipType);
  struct rlimit before {};
  ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &before), 0);
  const auto signalBefore = std::signal(SIGXFSZ, SIG_IGN);
  const struct rlimit small { 1000, before.rlim_max };
  ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
  const bool isWritten = fetcher->uncompressTo(path());
  ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &before), 0);
  (void)std::signal(SIGXFSZ, signalBefore);
  EXPECT_FALSE(isWritten);
  EXPECT_EQ(log.entries(), (Lines{error("Cannot write output file " + path() + ": File too large"),
                                  error("Could not uncompress HTTP response to " + path() + "!")}));
  EXPECT_FALSE(std::filesystem::exists(path()));
}

}  // namespace
}  // namespace brenvik
