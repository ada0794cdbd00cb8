// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// Both sides of the network worker, joined by real channels, with fakes behind the worker's side.
#include "workers/network/NetworkServing.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>

#include <cerrno>
#include <future>
#include <mutex>
#include <string>

#include "platform/base/fakes/FailingAllocations.h"
#include "platform/geo/fakes/ManualGeoService.h"
#include "platform/gzip/fakes/GzipOf.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/net/fakes/FakeEchoNetwork.h"
#include "platform/network/EchoMessages.h"
#include "platform/network/linux/NetworkAnswers.h"
#include "platform/network/linux/RemoteEchoNetwork.h"
#include "platform/network/linux/RemoteGeoService.h"
#include "platform/network/linux/RemoteGunzip.h"
#include "platform/network/linux/RemoteWebClient.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/web/fakes/ScriptedWebClient.h"
#include "platform/worker/fakes/ThreadedWorker.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

constexpr const char* kUrl = "https://server.example/file.gz";

std::span<const std::byte> bytesOf(const std::string& text) { return std::as_bytes(std::span(text)); }
std::string textOf(const WebBody& body) { return {reinterpret_cast<const char*>(body.data()), body.size()}; }

// Its bodies are for another process, as those of the worker's client.
class ScriptedWorkerClient final : public WebClient {
 public:
  explicit ScriptedWorkerClient(ScriptedWebClient& real) : real_(real) {}
  std::shared_ptr<WebSession> makeSession() override { return real_.makeSession(); }
  std::shared_ptr<WebRequest> makeRequest(WebRequestType type, const std::string& url,
                                          const HeaderMap& headers,
                                          std::shared_ptr<WebSession> session) override {
    auto request = real_.makeRequest(type, url, headers, std::move(session));
    return request != nullptr ? std::make_shared<Request>(std::move(request)) : nullptr;
  }

 private:
  class Request final : public WebRequest {
   public:
    explicit Request(std::shared_ptr<WebRequest> real) : real_(std::move(real)) {}
    void setCallbackQueue(std::shared_ptr<WorkQueue> queue) override {
      real_->setCallbackQueue(std::move(queue));
    }
    void setCompletion(Completion completion) override {
      real_->setCompletion(
          [completion = std::move(completion)](const std::shared_ptr<WebResponse>& response) {
            if (response != nullptr && !response->body.empty()) {
              WebBody body = WebBody::forAnotherProcess();
              body.append(response->body);
              response->body = std::move(body);
            }
            completion(response);
          });
    }
    void setTimeLimit(std::chrono::milliseconds limit) noexcept override { real_->setTimeLimit(limit); }
    void setLargestBody(std::uint64_t bytes) noexcept override { real_->setLargestBody(bytes); }
    void send(std::vector<std::byte> body) override { real_->send(std::move(body)); }
    void cancel() noexcept override { real_->cancel(); }

   private:
    const std::shared_ptr<WebRequest> real_;
  };
  ScriptedWebClient& real_;
};

// A geo service that answers by itself, on the queue that is named.
class AnsweringGeo final : public GeoTickets {
 public:
  std::unique_ptr<ReverseGeocodeTicket> makeReverseGeocodeTicket(Coordinate coordinate, IncludeEta,
                                                                 ShiftLocations, const GeoTraits*) override {
    class Ticket final : public ReverseGeocodeTicket {
     public:
      Ticket(AnsweringGeo& geo, Coordinate coordinate) : geo_(geo), coordinate_(coordinate) {}
      void submit(ReverseGeocodeHandler handler, const GeoNetworkActivity*,
                  const std::shared_ptr<WorkQueue>& queue) override {
        if (geo_.silent) return;
        {
          const std::lock_guard lock(geo_.mutex);  // several channels may ask at once
          geo_.asked = coordinate_;
        }
        queue->post([handler, items = geo_.items, error = geo_.error] { handler(items, error); });
      }

     private:
      AnsweringGeo& geo_;
      const Coordinate coordinate_;
    };
    return std::make_unique<Ticket>(*this, coordinate);
  }
  std::unique_ptr<GeoIpTicket> makeGeoIpTicket(const std::optional<std::string>&) override {
    class Ticket final : public GeoIpTicket {
     public:
      explicit Ticket(AnsweringGeo& geo) : geo_(geo) {}
      void submit(GeoIpHandler handler, const AuditToken*, const GeoNetworkActivity*,
                  const std::shared_ptr<WorkQueue>& queue) override {
        if (geo_.silent) return;
        queue->post([handler, address = geo_.address, error = geo_.error] { handler(address, error); });
      }

     private:
      AnsweringGeo& geo_;
    };
    return std::make_unique<Ticket>(*this);
  }

  bool silent = false;
  std::optional<MapItems> items;
  std::optional<GeoIpResult> address;
  std::optional<GeoError> error;
  std::mutex mutex;  // guards what follows
  Coordinate asked;
};

class NetworkServingTest : public testing::Test {
 protected:
  struct Fetched {
    std::shared_ptr<WebResponse> response;
    bool onItsQueue = false;
  };
  std::future<Fetched> begin(const HeaderMap& headers = {}, std::uint64_t largest = kLargestWebBody) {
    auto answer = std::make_shared<std::promise<Fetched>>();
    const auto session = remoteWeb.makeSession();
    session->setCellularAllowed(false);
    request = remoteWeb.makeRequest(WebRequestType::get, kUrl, headers, session);
    request->setCallbackQueue(callbacks);
    request->setTimeLimit(7s);
    request->setLargestBody(largest);
    request->setCompletion([this, answer](std::shared_ptr<WebResponse> response) {
      answer->set_value({std::move(response), callbacks->isCurrent()});
    });
    request->send({});
    return answer->get_future();
  }
  std::shared_ptr<WebResponse> fetch(const HeaderMap& headers = {}, std::uint64_t largest = kLargestWebBody) {
    const auto fetched = begin(headers, largest).get();
    EXPECT_TRUE(fetched.onItsQueue);
    return fetched.response;
  }
  struct Places {
    std::optional<MapItems> items;
    std::optional<GeoError> error;
  };
  Places askForPlace(Coordinate coordinate) {
    std::promise<Places> answer;
    remoteGeo.makeReverseGeocodeTicket(coordinate, IncludeEta::no, ShiftLocations::ifNeeded, nullptr)
        ->submit(
            [&](const auto& items, const auto& error) {
              answer.set_value({items, error});
            },
            nullptr, callbacks);
    return answer.get_future().get();
  }

  RecordingLog log;
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemQueues queues{*loop};
  ScriptedWebClient web;
  ScriptedWorkerClient workerWeb{web};
  AnsweringGeo geo;
  FakeEchoNetwork echo;
  NetworkServing serving{{queues, workerWeb, geo, echo}};
  ThreadedWorker worker{
      [this](std::uint32_t work, WorkerChannel channel) { serving.serve(work, std::move(channel)); }};
  NetworkAnswers answers{queues, worker};
  RemoteWebClient remoteWeb{answers};
  RemoteGunzip gunzip{worker};
  RemoteGeoService remoteGeo{answers, {"/nonexistent", "/nonexistent", "/nonexistent", "/nonexistent"}};
  RemoteEchoNetwork remoteEcho{worker};
  std::shared_ptr<WorkQueue> callbacks = queues.makeSerial("callbacks", QualityOfService::standard);
  std::shared_ptr<WebRequest> request;
};

// ---- web --------------------------------------------------------------------------------------------------

TEST_F(NetworkServingTest, ARequestGoesToTheWorkersClientAndItsResponseComesBackWhole) {
  const std::string body(3'000'000, 'b');
  web.answer(kUrl, 200, body, {{"Content-Type", "application/gzip"}, {"X", "1, 2"}});
  const auto response = fetch({{"Accept-Encoding", "gzip"}}, 5'000'000);
  EXPECT_EQ(response->errorKind, WebErrorKind::none);
  EXPECT_EQ(response->statusCode, 200);
  EXPECT_TRUE(textOf(response->body) == body);
  EXPECT_GE(response->body.sealedMemory(), 0) << "not copied";
  EXPECT_EQ(response->headers, (HeaderMap{{"Content-Type", "application/gzip"}, {"X", "1, 2"}}));
  const auto seen = web.seen().at(0);
  EXPECT_EQ(seen.url, kUrl);
  EXPECT_EQ(seen.headers, (HeaderMap{{"Accept-Encoding", "gzip"}}));
  EXPECT_FALSE(seen.cellularAllowed);
  EXPECT_EQ(seen.timeLimit, 7s);
  EXPECT_EQ(seen.largestBody, 5'000'000U);
}

TEST_F(NetworkServingTest, HeaderFieldsBeyondADatagramArriveToo) {
  HeaderMap headers;
  for (int i = 0; i < 1000; ++i) headers["X-" + std::to_string(i)] = std::string(200, 'h');
  web.answer(kUrl, 200, "body", headers);
  EXPECT_EQ(fetch()->headers, headers);
}

TEST_F(NetworkServingTest, FailuresArriveAsTheyWere) {
  for (const auto kind :
       {WebErrorKind::hostNotFound, WebErrorKind::cellularNotAllowed, WebErrorKind::certificateClock}) {
    web.fail(kUrl, kind);
    const auto response = fetch();
    EXPECT_EQ(response->errorKind, kind);
    EXPECT_TRUE(response->body.empty());
  }
  web.answer(kUrl, 404, "");
  EXPECT_EQ(fetch()->statusCode, 404);
}

TEST_F(NetworkServingTest, AUrlThatNoRequestCanBeMadeForIsRefusedByTheHelperItself) {
  EXPECT_EQ(remoteWeb.makeRequest(WebRequestType::get, "http://host/", {}, remoteWeb.makeSession()), nullptr);
  const std::string longest = "https://host/" + std::string(RemoteWebClient::kLongestUrl, 'x');
  EXPECT_EQ(remoteWeb.makeRequest(WebRequestType::get, longest, {}, remoteWeb.makeSession()), nullptr);
  EXPECT_EQ(worker.opened(), 0);
}

TEST_F(NetworkServingTest, WithoutAWorkerARequestCompletesAsUnavailable) {
  worker.answerWith(WorkerResult::unavailable);
  EXPECT_EQ(fetch()->errorKind, WebErrorKind::clientUnavailable);
  worker.answerWith(WorkerResult::outOfMemory);
  EXPECT_EQ(fetch()->errorKind, WebErrorKind::clientUnavailable);
}

TEST_F(NetworkServingTest, AWorkerThatDiesDuringARequestIsToldOfAtOnceAndTheNextRequestHasANewOne) {
  web.answer(kUrl, 200, "body");
  for (int i = 0; i < 10; ++i) {
    web.holdAnswers();
    auto fetched = begin();
    while (web.seen().size() <= static_cast<std::size_t>(i)) std::this_thread::yield();
    worker.die();
    EXPECT_EQ(fetched.get().response->errorKind, WebErrorKind::clientUnavailable);
    web.releaseAnswers();
  }
  web.answer(kUrl, 200, "body");
  EXPECT_EQ(textOf(fetch()->body), "body");
}

TEST_F(NetworkServingTest, ACancelledRequestCompletesAndTheWorkerEndsItsOwn) {
  web.answer(kUrl, 200, "body");
  web.holdAnswers();
  auto fetched = begin();
  while (web.seen().empty()) std::this_thread::yield();
  request->cancel();
  EXPECT_EQ(fetched.get().response->errorKind, WebErrorKind::cancelled);
  while (web.cancelled == 0) std::this_thread::yield();
  EXPECT_EQ(worker.givenUp(), 0);
}

TEST_F(NetworkServingTest, WhatIsUnderWayAtTheShutdownCompletesAsCancelled) {
  web.answer(kUrl, 200, "body");
  web.holdAnswers();
  auto fetched = begin();
  while (web.seen().empty()) std::this_thread::yield();
  answers.shutDown();
  EXPECT_EQ(fetched.get().response->errorKind, WebErrorKind::cancelled);
  EXPECT_EQ(fetch()->errorKind, WebErrorKind::cancelled) << "and so does every later one";
}

// ---- gunzip -----------------------------------------------------------------------------------------------

class NetworkGunzipTest : public NetworkServingTest {
 protected:
  std::string written() {
    std::string content(2'000'000, '\0');
    content.resize(static_cast<std::size_t>(
        std::max<ssize_t>(::pread(file.get(), content.data(), content.size(), 0), 0)));
    return content;
  }
  UniqueFd file{::memfd_create("output", MFD_CLOEXEC)};
};

TEST_F(NetworkGunzipTest, AFileIsUnpackedIntoTheDescriptorFromPlainAndFromSealedMemory) {
  const std::string original(1'500'000, 'g');
  const std::string packed = gzipOf(original);
  auto outcome = gunzip.gunzipInto({bytesOf(packed)}, file.get(), 2'000'000, 3'000'000);
  EXPECT_EQ(outcome.result, GunzipResult::whole);
  EXPECT_EQ(outcome.size, original.size());
  EXPECT_TRUE(written() == original);

  WebBody made = WebBody::forAnotherProcess();
  made.append(bytesOf(packed));
  const auto body = WebBody::ofSealedMemory(made.takeSealed(), packed.size());
  ASSERT_TRUE(body);
  file.reset(::memfd_create("output", MFD_CLOEXEC));
  outcome = gunzip.gunzipInto({*body, body->sealedMemory()}, file.get(), 2'000'000, 3'000'000);
  EXPECT_EQ(outcome.result, GunzipResult::whole);
  EXPECT_TRUE(written() == original);
}

TEST_F(NetworkGunzipTest, FailuresArriveAsTheyWere) {
  EXPECT_EQ(gunzip.gunzipInto({bytesOf("not gzip")}, file.get(), 10, 10).result, GunzipResult::damaged);
  EXPECT_EQ(gunzip.gunzipInto({}, file.get(), 10, 10).result, GunzipResult::truncated);
  const std::string packed = gzipOf(std::string(100'000, 'x'));
  EXPECT_EQ(gunzip.gunzipInto({bytesOf(packed)}, file.get(), 10, 10).result, GunzipResult::tooLarge);
  const auto counted = gunzip.gunzipInto({bytesOf(packed)}, file.get(), 10, 1'000'000);
  EXPECT_EQ(counted.result, GunzipResult::whole);
  EXPECT_EQ(counted.size, 100'000U);
  file.reset(::open("/dev/full", O_WRONLY | O_CLOEXEC));
  const auto full = gunzip.gunzipInto({bytesOf(packed)}, file.get(), 1'000'000, 1'000'000);
  EXPECT_EQ(full.result, GunzipResult::refused);
  EXPECT_EQ(full.writeError, ENOSPC);
}

TEST_F(NetworkGunzipTest, WithoutAWorkerAndAfterTheShutdownItIsUnavailable) {
  worker.answerWith(WorkerResult::unavailable);
  EXPECT_EQ(gunzip.gunzipInto({bytesOf("x")}, file.get(), 10, 10).result, GunzipResult::unavailable);
  worker.answerWith(WorkerResult::done);
  gunzip.shutDown();
  EXPECT_EQ(gunzip.gunzipInto({bytesOf("x")}, file.get(), 10, 10).result, GunzipResult::unavailable);
}

// ---- geo --------------------------------------------------------------------------------------------------

TEST_F(NetworkServingTest, APlaceIsLookedUpByTheWorkerAndItsCountryIsRemembered) {
  geo.items = MapItems{MapItem{true, GeoAddress{StructuredAddress{"FR", {}, "Paris", {}}}}};
  EXPECT_EQ(remoteGeo.currentCountryCode(), std::nullopt);
  const auto places = askForPlace({48.8584, 2.2945});
  EXPECT_FALSE(places.error);
  EXPECT_EQ(places.items.value().at(0)->address->structuredAddress->locality, "Paris");
  EXPECT_EQ(geo.asked.latitude, 48.8584);
  EXPECT_EQ(geo.asked.longitude, 2.2945);
  EXPECT_EQ(remoteGeo.currentCountryCode(), "FR");
}

TEST_F(NetworkServingTest, AnAddressLongerThanADatagramArrives) {
  const std::string locality(64'000, 'x');
  geo.items = MapItems{MapItem{true, GeoAddress{StructuredAddress{"FR", {}, locality, {}}}}};
  EXPECT_TRUE(askForPlace({1, 2}).items.value().at(0)->address->structuredAddress->locality == locality);
}

TEST_F(NetworkServingTest, GeoErrorsArriveAndWithoutAWorkerThereIsOne) {
  geo.error = GeoError{"the offline gazetteer cannot be read"};
  EXPECT_EQ(askForPlace({1, 2}).error.value().description, "the offline gazetteer cannot be read");
  worker.answerWith(WorkerResult::unavailable);
  EXPECT_EQ(askForPlace({1, 2}).error.value().description, "the network worker is not available");
  worker.answerWith(WorkerResult::outOfMemory);
  EXPECT_EQ(askForPlace({1, 2}).error.value().description,
            "the geo service has no thread or memory to work with");
}

TEST_F(NetworkServingTest, ThePublicAddressIsFoundByTheWorker) {
  geo.address = GeoIpResult{"203.0.113.7"};
  const auto ask = [&](const std::optional<std::string>& of) {
    std::promise<std::string> answer;
    remoteGeo.makeGeoIpTicket(of)->submit(
        [&](const auto& result, const auto& error) {
          answer.set_value(result ? result->ipAddress : error.value().description);
        },
        nullptr, nullptr, callbacks);
    return answer.get_future().get();
  };
  EXPECT_EQ(ask(std::nullopt), "203.0.113.7");
  EXPECT_EQ(ask("192.0.2.1"), "only this device's own address can be looked up");
  EXPECT_EQ(worker.opened(), 1);
}

TEST_F(NetworkServingTest, OfAFloodOfQuestionsTheWorkerHasAFewAtATimeAndAllAreAnswered) {
  geo.items = MapItems{};
  geo.silent = true;
  constexpr int kQuestions = 200;
  std::atomic<int> answered{0};
  std::promise<void> all;
  const auto ask = [&] {
    remoteGeo.makeReverseGeocodeTicket({1, 2}, IncludeEta::no, ShiftLocations::ifNeeded, nullptr)
        ->submit(
            [&](const auto&, const auto&) {
              if (++answered == kQuestions) all.set_value();
            },
            nullptr, callbacks);
  };
  for (int i = 0; i < kQuestions; ++i) ask();
  while (worker.opened() < static_cast<int>(NetworkAnswers::kMaxOpen)) std::this_thread::yield();
  EXPECT_EQ(answered, 0);
  worker.answerWith(WorkerResult::unavailable);
  worker.die();
  all.get_future().get();
  EXPECT_GE(worker.opened(), kQuestions);
}

TEST_F(NetworkServingTest, AnAnswerWhoseQueueIsGoneIsDropped) {
  geo.items = MapItems{};
  auto gone = queues.makeSerial("gone", QualityOfService::standard);
  remoteGeo.makeReverseGeocodeTicket({1, 2}, IncludeEta::no, ShiftLocations::ifNeeded, nullptr)
      ->submit([](const auto&, const auto&) { ADD_FAILURE() << "its queue is gone"; }, nullptr, gone);
  gone.reset();
  EXPECT_TRUE(askForPlace({1, 2}).items);
}

// ---- echo -------------------------------------------------------------------------------------------------

TEST_F(NetworkServingTest, AProbeRunsInTheWorkerStepByStep) {
  echo.hostAddress = in_addr{0x0100007F};
  echo.cellularIndex = 7;
  echo.raw = true;
  EXPECT_EQ(remoteEcho.addressOfHost("host.example").value().s_addr, 0x0100007FU);
  EXPECT_EQ(remoteEcho.protocolByName("icmp"), 1);
  EXPECT_EQ(remoteEcho.protocolByName("nonsense"), std::nullopt);
  EXPECT_EQ(remoteEcho.indexOfInterface("pdp_ip0"), 7U);
  EXPECT_EQ(remoteEcho.indexOfInterface("eth0"), 0U);
  {
    const auto socket = remoteEcho.openEchoSocket(1, 0xBEEF);
    ASSERT_NE(socket, nullptr);
    EXPECT_TRUE(socket->deliversIpHeader());
    socket->setReceiveBufferSize(51'200);
    socket->bindToInterface(7);
    EXPECT_EQ(socket->setReceiveTimeOut(1s), 0);
    const std::vector<std::byte> message(48, std::byte{8});
    const auto sent = socket->sendTo(in_addr{0x0100007F}, message);
    EXPECT_EQ(sent.count, 48);
    EXPECT_EQ(sent.error, 0);
    echo.arrivals.push_back({1ms, std::vector<std::byte>(60, std::byte{9})});
    std::array<std::byte, 2048> buffer{};
    const auto received = socket->receive(buffer);
    EXPECT_EQ(received.count, 60);
    EXPECT_EQ(buffer[59], std::byte{9});
    const auto none = socket->receive(buffer);
    EXPECT_EQ(none.count, -1);
    EXPECT_EQ(none.error, EAGAIN);
    EXPECT_EQ(echo.sent, std::vector<std::vector<std::byte>>{message});
    EXPECT_EQ(echo.opened, (std::vector<std::pair<int, std::uint16_t>>{{1, 0xBEEF}}));
    EXPECT_EQ(echo.calls,
              (std::vector<std::string>{"buffer 51200", "interface 7", "time-out 1000000", "send"}));
  }
  echo.refuseSockets = true;
  EXPECT_EQ(remoteEcho.openEchoSocket(1, 1), nullptr);
  EXPECT_EQ(worker.givenUp(), 0);
}

TEST_F(NetworkServingTest, ASocketWhoseWorkerHasDiedFailsAndSoDoLookUpsWithoutOne) {
  const auto socket = remoteEcho.openEchoSocket(1, 0xBEEF);
  ASSERT_NE(socket, nullptr);
  worker.die();
  EXPECT_EQ(socket->setReceiveTimeOut(1s), EPIPE);
  EXPECT_EQ(socket->sendTo({}, {}).error, EPIPE);
  std::array<std::byte, 16> buffer{};
  EXPECT_EQ(socket->receive(buffer).error, EPIPE);
  worker.answerWith(WorkerResult::unavailable);
  EXPECT_EQ(remoteEcho.addressOfHost("host"), std::nullopt);
  EXPECT_EQ(remoteEcho.protocolByName("icmp"), std::nullopt);
  EXPECT_EQ(remoteEcho.indexOfInterface("pdp_ip0"), 0U);
  EXPECT_EQ(remoteEcho.openEchoSocket(1, 1), nullptr);
}

// ---- what the helper may not ask --------------------------------------------------------------------------

TEST_F(NetworkServingTest, QuestionsThatAreNoneCloseTheirChannelAndTheWorkerGoesOn) {
  for (std::uint32_t work = 0; work <= 6; ++work) {
    for (std::uint32_t kind = 0; kind <= 12; ++kind) {
      WorkerChannel channel;
      ASSERT_EQ(worker.open(work, &channel), WorkerResult::done);
      (void)channel.send({kind, std::vector<std::byte>(7, std::byte{0xFF}), {}});
      WorkerMessage message;
      EXPECT_EQ(channel.receive(&message, std::chrono::steady_clock::now() + 5s), WorkerResult::closed)
          << work << " " << kind;
    }
  }
  web.answer(kUrl, 200, "body");
  EXPECT_EQ(textOf(fetch()->body), "body");
}

TEST_F(NetworkServingTest, MoreThanTheLongestEchoIsNotReceivedInto) {
  for (const auto& [largest, expected] :
       {std::pair{kLongestEcho, WorkerResult::done}, std::pair{kLongestEcho + 1, WorkerResult::closed}}) {
    WorkerChannel channel;
    ASSERT_EQ(worker.open(static_cast<std::uint32_t>(NetworkWork::echo), &channel), WorkerResult::done);
    const auto ask = [&](EchoMessageKind kind, std::vector<std::byte> payload) {
      (void)channel.send({static_cast<std::uint32_t>(kind), std::move(payload), {}});
      WorkerMessage message;
      return channel.receive(&message, std::chrono::steady_clock::now() + 5s);
    };
    ASSERT_EQ(ask(EchoMessageKind::openSocket, encodeSocket(1, 1)), WorkerResult::done);
    echo.arrivals.push_back({1ms, std::vector<std::byte>(60, std::byte{9})});
    EXPECT_EQ(ask(EchoMessageKind::receive, encodeNumber(static_cast<std::uint32_t>(largest))), expected);
  }
}

TEST_F(NetworkServingTest, AChannelForWhichThereIsNoThreadOrMemoryIsRefusedAndLeavesItsPlace) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "nothing fails under this sanitizer";
  geo.silent = true;
  NetworkServing other{{queues, workerWeb, geo, echo}};
  int refusals = 0;
  for (bool hasFailed = true; hasFailed;) {
    WorkerChannel ours;
    WorkerChannel theirs;
    ASSERT_EQ(WorkerChannel::makePair(&ours, &theirs), WorkerResult::done);
    {
      const FailingAllocations failing(refusals, FailingAllocations::HowMany::one);
      other.start(static_cast<std::uint32_t>(NetworkWork::publicAddress), std::move(theirs));
    }
    hasFailed = FailingAllocations::failures() > 0;
    if (!hasFailed) continue;
    ++refusals;
    WorkerMessage message;
    ASSERT_EQ(ours.receive(&message, std::chrono::steady_clock::now() + 5s), WorkerResult::done) << refusals;
    EXPECT_EQ(message.kind, static_cast<std::uint32_t>(NetworkMessage::refusal));
  }
  EXPECT_GE(refusals, 2) << "the channel, and what a thread is handed";
  other.waitUntilIdle();
}

TEST_F(NetworkServingTest, ChannelsBeyondTheMostAreRefused) {
  geo.silent = true;
  NetworkServing other{{queues, workerWeb, geo, echo}};
  std::vector<WorkerChannel> ours;
  const auto open = [&] {
    WorkerChannel theirs;
    EXPECT_EQ(WorkerChannel::makePair(&ours.emplace_back(), &theirs), WorkerResult::done);
    other.start(static_cast<std::uint32_t>(NetworkWork::publicAddress), std::move(theirs));
    EXPECT_EQ(ours.back().send({static_cast<std::uint32_t>(NetworkMessage::ask), {}, {}}),
              WorkerResult::done);
  };
  for (int i = 0; i < NetworkServing::kMaxChannels; ++i) open();
  WorkerMessage message;
  EXPECT_EQ(ours.back().receive(&message, std::chrono::steady_clock::now()), WorkerResult::timedOut);
  WorkerChannel theirs;
  ASSERT_EQ(WorkerChannel::makePair(&ours.emplace_back(), &theirs), WorkerResult::done);
  other.start(static_cast<std::uint32_t>(NetworkWork::publicAddress), std::move(theirs));
  ASSERT_EQ(ours.back().receive(&message, std::chrono::steady_clock::now() + 5s), WorkerResult::done);
  EXPECT_EQ(message.kind, static_cast<std::uint32_t>(NetworkMessage::refusal));
  ours.clear();
  other.waitUntilIdle();
}

}  // namespace
}  // namespace brenvik
