// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// The helper's side of the network worker, beside workers that lie, hang and flood.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <future>
#include <mutex>
#include <string>

#include "platform/base/fakes/LingeringSocket.h"
#include "platform/network/EchoMessages.h"
#include "platform/network/GeoMessages.h"
#include "platform/network/GunzipMessages.h"
#include "platform/network/WebMessages.h"
#include "platform/network/linux/LargeMessage.h"
#include "platform/network/linux/NetworkAnswers.h"
#include "platform/network/linux/RemoteEchoNetwork.h"
#include "platform/network/linux/RemoteGeoService.h"
#include "platform/network/linux/RemoteGunzip.h"
#include "platform/network/linux/RemoteWebClient.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/worker/fakes/ThreadedWorker.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

constexpr auto kForEver = Clock::time_point::max();
// What the tests' workers are given before they count as hung.
constexpr auto kSilence = 100ms;

constexpr std::uint32_t number(NetworkMessage kind) { return static_cast<std::uint32_t>(kind); }
constexpr auto kAnswer = number(NetworkMessage::answer);
constexpr auto kAlive = number(NetworkMessage::alive);

enum class Sealed { no, yes };
UniqueFd memoryWith(const std::string& text, Sealed sealed = Sealed::yes) {
  UniqueFd memory = makeSealableMemory("lie");
  EXPECT_EQ(::write(memory.get(), text.data(), text.size()), static_cast<ssize_t>(text.size()));
  const bool isDone = sealed == Sealed::no || sealMemory(memory.get());
  EXPECT_TRUE(isDone);
  return memory;
}
std::string textOf(const std::vector<std::byte>& bytes) {
  return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
}
std::vector<UniqueFd> one(UniqueFd fd) {
  std::vector<UniqueFd> descriptors;
  descriptors.push_back(std::move(fd));
  return descriptors;
}
std::vector<UniqueFd> two(UniqueFd first, UniqueFd second) {
  auto descriptors = one(std::move(first));
  descriptors.push_back(std::move(second));
  return descriptors;
}

// After the question, does as it is told, and then waits until the helper hangs up.
class LyingWorkerTest : public testing::Test {
 protected:
  using Lie = std::function<void(WorkerChannel&)>;
  void serve(WorkerChannel channel) {
    WorkerMessage message;
    if (channel.receive(&message, kForEver) != WorkerResult::done) return;
    if (hangsUp) return;
    if (lie) lie(channel);
    while (channel.receive(&message, kForEver) == WorkerResult::done) {
    }
  }
  // Sends one message in the answer's place.
  void answersWith(std::function<WorkerMessage()> make) {
    lie = [make](WorkerChannel& channel) { EXPECT_EQ(channel.send(make()), WorkerResult::done); };
  }

  std::shared_ptr<WebResponse> fetch(std::uint64_t largest = 100) { return fetchBy(web, largest); }
  std::shared_ptr<WebResponse> fetchBy(RemoteWebClient& client, std::uint64_t largest = 100) {
    std::promise<std::shared_ptr<WebResponse>> answer;
    const auto request = client.makeRequest(WebRequestType::get, "https://host/", {}, client.makeSession());
    request->setCallbackQueue(callbacks);
    request->setLargestBody(largest);
    request->setCompletion(
        [&](std::shared_ptr<WebResponse> response) { answer.set_value(std::move(response)); });
    request->send({});
    return answer.get_future().get();
  }
  std::string askForPlace() {
    std::promise<std::string> answer;
    geo.makeReverseGeocodeTicket({1, 2}, IncludeEta::no, ShiftLocations::ifNeeded, nullptr)
        ->submit(
            [&](const auto&, const auto& error) { answer.set_value(error ? error->description : "none"); },
            nullptr, callbacks);
    return answer.get_future().get();
  }
  GunzipResult unpack() { return unpackBy(gunzip); }
  GunzipResult unpackBy(RemoteGunzip& by) {
    return by.gunzipInto({std::as_bytes(std::span("gzip", 4))}, file.get(), 10, 10).result;
  }
  // Nonsense costs the worker its life, once, and nobody else anything.
  void expectGivenUp(int times) {
    // The worker is ended a moment after whoever asked has been told.
    for (const auto end = Clock::now() + 5s; worker.givenUp() < times && Clock::now() < end;)
      std::this_thread::yield();
    EXPECT_EQ(worker.givenUp(), times);
  }

  Lie lie;
  bool hangsUp = false;
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemQueues queues{*loop};
  ThreadedWorker worker{[this](std::uint32_t, WorkerChannel channel) { serve(std::move(channel)); }};
  NetworkAnswers answers{queues, worker, kSilence};
  RemoteWebClient web{answers};
  RemoteGunzip gunzip{worker, kSilence};
  RemoteGeoService geo{answers, {"/nonexistent", "/nonexistent", "/nonexistent", "/nonexistent"}};
  RemoteEchoNetwork echo{worker, kSilence};
  std::shared_ptr<WorkQueue> callbacks = queues.makeSerial("callbacks", QualityOfService::standard);
  UniqueFd file{::memfd_create("output", MFD_CLOEXEC)};
};

TEST_F(LyingWorkerTest, AnAnswerAboutABodyThatIsNotThereOrNotSealedOrOfAnotherSizeIsNone) {
  const auto told = [](std::uint64_t size) { return encode(WebAnswer{WebErrorKind::none, 200, {}, size}); };
  const std::vector<std::function<WorkerMessage()>> lies{
      [&] { return packLarge(kAnswer, told(4)); },
      [&] { return packLarge(kAnswer, told(4), one(memoryWith("body", Sealed::no))); },
      [&] { return packLarge(kAnswer, told(4), one(memoryWith("bod"))); },
      [&] { return packLarge(kAnswer, told(4), one(memoryWith("bodyy"))); },
      [&] { return packLarge(kAnswer, told(4), one(UniqueFd(::open("/dev/zero", O_RDONLY | O_CLOEXEC)))); },
      [&] {
        return packLarge(kAnswer, told(4), one(UniqueFd(::open("/proc/self/exe", O_RDONLY | O_CLOEXEC))));
      },
      [&] { return packLarge(kAnswer, told(4), two(memoryWith("body"), memoryWith("body"))); },
      [&] { return packLarge(kAnswer, told(0), one(memoryWith("body"))); },
      [&] { return packLarge(kAnswer, told(101), one(memoryWith(std::string(101, 'b')))); },
      [&] {
        return packLarge(kAnswer, encode(WebAnswer{WebErrorKind::timedOut, 200, {}, 4}),
                         one(memoryWith("body")));
      },
      [&] {
        return WorkerMessage{kAnswer, {}, {}};
      },
      [&] {
        return WorkerMessage{kAnswer, {std::byte{1}}, {}};
      },
      [&] {
        return WorkerMessage{kAnswer, {std::byte{1}}, one(memoryWith("unsealed", Sealed::no))};
      },
      [&] {
        return WorkerMessage{
            kAnswer, {std::byte{1}}, one(memoryWith(std::string(kLongestLargePayload + 1, 'x')))};
      },
      // Answers that are good, but for the way they travel.
      [&] {
        const WebAnswer longer{WebErrorKind::none, 200, {{"x", std::string(kLongestLargePayload, 'x')}}, 0};
        return WorkerMessage{kAnswer, {std::byte{1}}, one(memoryWith(textOf(encode(longer))))};
      },
      [&] {
        return WorkerMessage{kAnswer, {std::byte{1}, std::byte{1}}, one(memoryWith(textOf(told(0))))};
      },
      [&] {
        return WorkerMessage{kAnswer, {std::byte{1}}, one(memoryWith(textOf(told(0)), Sealed::no))};
      },
      [&] {
        return WorkerMessage{kAnswer, {std::byte{2}}, {}};
      },
      [&] {
        return WorkerMessage{99, {}, {}};
      },
      [&] {
        return WorkerMessage{kAlive, {std::byte{1}}, {}};
      },
  };
  int count = 0;
  for (const auto& each : lies) {
    answersWith(each);
    const auto response = fetch();
    EXPECT_EQ(response->errorKind, WebErrorKind::clientUnavailable) << count;
    EXPECT_TRUE(response->body.empty());
    expectGivenUp(++count);
  }
  answersWith([&] { return packLarge(kAnswer, told(4), one(memoryWith("body"))); });
  EXPECT_EQ(fetch()->body.size(), 4U) << "the truth is taken";
}

TEST_F(LyingWorkerTest, AWorkerThatSaysNothingIsGivenUp) {
  EXPECT_EQ(fetch()->errorKind, WebErrorKind::clientUnavailable);
  expectGivenUp(1);
  EXPECT_EQ(unpack(), GunzipResult::unavailable);
  expectGivenUp(2);
  EXPECT_EQ(askForPlace(), "the network worker is not available");
  expectGivenUp(3);
  EXPECT_EQ(echo.protocolByName("icmp"), std::nullopt);
  expectGivenUp(4);
  EXPECT_EQ(echo.openEchoSocket(1, 1), nullptr);
  expectGivenUp(5);
}

TEST_F(LyingWorkerTest, AWorkerThatHangsUpIsGivenUpAtOnce) {
  hangsUp = true;
  EXPECT_EQ(fetch()->errorKind, WebErrorKind::clientUnavailable);
  EXPECT_EQ(unpack(), GunzipResult::unavailable);
  EXPECT_EQ(askForPlace(), "the network worker is not available");
  EXPECT_EQ(echo.indexOfInterface("pdp_ip0"), 0U);
  EXPECT_EQ(worker.opened(), 4);
}

TEST_F(LyingWorkerTest, SignsOfLifeKeepARequestAndAFloodOfThemDoesNot) {
  {
    static constexpr auto kPatience =
        1000ms;  // a sign of life may come late where others have the processors
    NetworkAnswers patient(queues, worker, kPatience);
    RemoteWebClient client(patient);
    lie = [](WorkerChannel& channel) {
      for (int i = 0; i < 12; ++i) {
        std::this_thread::sleep_for(kPatience / 10);
        if (channel.send({kAlive, {}, {}}) != WorkerResult::done) return;
      }
      (void)channel.send(packLarge(kAnswer, encode(WebAnswer{WebErrorKind::none, 204, {}, 0})));
    };
    EXPECT_EQ(fetchBy(client)->statusCode, 204);
    expectGivenUp(0);
  }
  lie = [](WorkerChannel& channel) {
    for (auto sent = WorkerResult::done; sent == WorkerResult::done || sent == WorkerResult::full;)
      sent = channel.send({kAlive, {}, {}});
  };
  EXPECT_EQ(fetch()->errorKind, WebErrorKind::clientUnavailable);
  expectGivenUp(1);
  EXPECT_EQ(unpack(), GunzipResult::unavailable);
  expectGivenUp(2);
}

TEST_F(LyingWorkerTest, ADescriptorWhoseCloseWaitsKeepsNobodyWaiting) {
  std::mutex mutex;
  std::vector<UniqueFd> peers;
  std::uint32_t kind = 0;
  std::vector<std::byte> payload;
  lie = [&](WorkerChannel& channel) {
    LingeringSocket lingering(10);
    WorkerMessage sent{kind, payload, one(std::move(lingering.socket))};
    {
      const std::lock_guard lock(mutex);
      peers.push_back(std::move(lingering.listening));  // whose peer takes nothing
    }
    EXPECT_EQ(channel.send(sent), WorkerResult::done);
  };
  const auto before = Clock::now();
  int times = 0;
  for (const auto each : {kAnswer, kAlive, number(NetworkMessage::refusal), 1000U}) {
    kind = each;
    EXPECT_EQ(fetch()->errorKind, WebErrorKind::clientUnavailable) << kind;
    expectGivenUp(++times);
    EXPECT_EQ(unpack(), GunzipResult::unavailable) << kind;
    expectGivenUp(++times);
    EXPECT_EQ(askForPlace(), "the network worker is not available") << kind;
    expectGivenUp(++times);
  }
  kind = static_cast<std::uint32_t>(EchoMessageKind::openSocket);
  payload = {std::byte{1}};
  EXPECT_EQ(echo.openEchoSocket(1, 1), nullptr);
  expectGivenUp(++times);
  answers.shutDown();
  EXPECT_LT(Clock::now() - before, 10s) << "each of the thirteen lingers so long";
}

TEST_F(LyingWorkerTest, AnUnpackingIsNotKeptByMoreThanAThousandSignsOfLife) {
  int signs = 1000;
  lie = [&signs](WorkerChannel& channel) {
    const auto send = [&channel](const WorkerMessage& message) {
      auto sent = WorkerResult::full;  // as long as the reader is slower
      while (sent == WorkerResult::full) sent = channel.send(message);
      return sent == WorkerResult::done;
    };
    for (int i = 0; i < signs; ++i) {
      if (!send({kAlive, {}, {}})) return;
    }
    (void)send({kAnswer, encode(GunzipOutcome{GunzipResult::whole, 4, 0}), {}});
  };
  RemoteGunzip patient(worker, 20s);
  EXPECT_EQ(unpackBy(patient), GunzipResult::whole);
  signs = 1001;
  EXPECT_EQ(unpackBy(patient), GunzipResult::unavailable);
  expectGivenUp(1);
}

TEST_F(LyingWorkerTest, SignsOfLifeKeepNoQuestionBeyondItsLimit) {
  lie = [](WorkerChannel& channel) {
    for (auto sent = WorkerResult::done; sent == WorkerResult::done || sent == WorkerResult::full;) {
      sent = channel.send({kAlive, {}, {}});
      std::this_thread::sleep_for(kSilence / 5);
    }
  };
  std::promise<NetworkAnswers::Ended> ended;
  auto future = ended.get_future();
  answers.ask(NetworkWork::web, {number(NetworkMessage::ask), {}, {}}, kSilence * 3,
              [&](NetworkAnswers::Ended how, WorkerMessage*) {
                ended.set_value(how);
                return true;
              });
  const auto came = future.wait_for(10s);
  if (came != std::future_status::ready) answers.shutDown();
  EXPECT_EQ(came, std::future_status::ready);
  EXPECT_EQ(future.get(), NetworkAnswers::Ended::unavailable);
  expectGivenUp(1);
}

TEST_F(LyingWorkerTest, OfASortOfQuestionsTheWorkerHasNoMoreThanTheMost) {
  lie = [](WorkerChannel&) {};  // it takes them all, and says nothing
  NetworkAnswers patient(queues, worker, 1min);
  std::atomic<std::size_t> cancelled{0};
  const auto ask = [&](NetworkWork work) {
    patient.ask(work, {number(NetworkMessage::ask), {}, {}}, 1min,
                [&](NetworkAnswers::Ended how, WorkerMessage*) {
                  if (how == NetworkAnswers::Ended::cancelled) ++cancelled;
                  return true;
                });
  };
  for (std::size_t i = 0; i < NetworkAnswers::kMaxOpen + 5; ++i) ask(NetworkWork::web);
  ask(NetworkWork::reverseGeocode);  // has its own line, and comes after them
  for (const auto end = Clock::now() + 10s;
       worker.opened() < static_cast<int>(NetworkAnswers::kMaxOpen) + 1 && Clock::now() < end;)
    std::this_thread::yield();
  EXPECT_EQ(worker.opened(), static_cast<int>(NetworkAnswers::kMaxOpen) + 1);
  patient.shutDown();
  EXPECT_EQ(cancelled, NetworkAnswers::kMaxOpen + 6);
}

TEST_F(LyingWorkerTest, ARefusalEndsTheQuestionAndNotTheWorker) {
  answersWith([] { return WorkerMessage{number(NetworkMessage::refusal), {}, {}}; });
  EXPECT_EQ(fetch()->errorKind, WebErrorKind::clientUnavailable);
  EXPECT_EQ(unpack(), GunzipResult::outOfMemory);
  EXPECT_EQ(askForPlace(), "the geo service has no thread or memory to work with");
  answersWith([] { return WorkerMessage{static_cast<std::uint32_t>(EchoMessageKind::refusal), {}, {}}; });
  EXPECT_EQ(echo.openEchoSocket(1, 1), nullptr);
  expectGivenUp(0);
}

TEST_F(LyingWorkerTest, AnUnpackingThatCannotBeIsNone) {
  const std::vector<GunzipOutcome> lies{
      {GunzipResult::whole, 11, 0}, {GunzipResult::refused, 1, 0}, {static_cast<GunzipResult>(9), 1, 0}};
  for (const auto& each : lies) {
    answersWith([&] { return WorkerMessage{kAnswer, encode(each), {}}; });
    EXPECT_EQ(unpack(), GunzipResult::unavailable);
  }
  answersWith([&] {
    return WorkerMessage{kAnswer, encode(GunzipOutcome{GunzipResult::whole, 4, 0}), one(memoryWith("x"))};
  });
  EXPECT_EQ(unpack(), GunzipResult::unavailable);
  expectGivenUp(4);
}

TEST_F(LyingWorkerTest, TextsInTheWrongPlaceOfAnAddressAreNone) {
  const auto place = [](StructuredAddress address) {
    return encode(
        GeoOutcome<MapItems>{MapItems{MapItem{true, GeoAddress{std::move(address)}}}, std::nullopt});
  };
  for (const auto& address :
       {StructuredAddress{"norway", {}, {}, {}}, StructuredAddress{{}, "\xff", {}, {}}}) {
    answersWith([&] { return packLarge(kAnswer, place(address)); });
    EXPECT_EQ(askForPlace(), "the network worker is not available");
  }
  expectGivenUp(2);
  EXPECT_EQ(geo.currentCountryCode(), std::nullopt);
}

TEST_F(LyingWorkerTest, EchoAnswersOfAnotherKindOrMoreThanWasAskedForAreNone) {
  // Opens the socket as it should, and then answers each receive with too much.
  lie = [](WorkerChannel& channel) {
    (void)channel.send({static_cast<std::uint32_t>(EchoMessageKind::openSocket), {std::byte{1}}, {}});
    WorkerMessage message;
    if (channel.receive(&message, kForEver) != WorkerResult::done) return;
    (void)channel.send({message.kind, std::vector<std::byte>(5000, std::byte{0x7F}), {}});
  };
  const auto socket = echo.openEchoSocket(1, 1);
  ASSERT_NE(socket, nullptr);
  std::array<std::byte, 48> buffer{};
  EXPECT_EQ(socket->receive(buffer).count, -1);
  expectGivenUp(1);
  EXPECT_EQ(socket->sendTo({}, buffer).error, EPIPE) << "the conversation is over";
}

TEST_F(LyingWorkerTest, NumbersThatNoKernelGivesAreNone) {
  const auto opensAndSays = [this](std::uint32_t said) {
    lie = [said](WorkerChannel& channel) {
      (void)channel.send({static_cast<std::uint32_t>(EchoMessageKind::openSocket), {std::byte{1}}, {}});
      WorkerMessage message;
      if (channel.receive(&message, kForEver) != WorkerResult::done) return;
      (void)channel.send({message.kind, encodeNumber(said), {}});
    };
    const auto socket = echo.openEchoSocket(1, 1);
    return socket == nullptr ? -1 : socket->setReceiveTimeOut(1s);
  };
  EXPECT_EQ(opensAndSays(EPERM), EPERM);
  EXPECT_EQ(opensAndSays(4096), EPIPE);
  EXPECT_EQ(opensAndSays(0xFFFFFFFF), EPIPE);
  const auto protocolWhenTold = [this](std::uint32_t said) {
    answersWith([said] {
      return WorkerMessage{
          static_cast<std::uint32_t>(EchoMessageKind::protocolByName), encodeNumber(said), {}};
    });
    return echo.protocolByName("icmp");
  };
  EXPECT_EQ(protocolWhenTold(255), 255);
  EXPECT_EQ(protocolWhenTold(256), std::nullopt);
}

}  // namespace
}  // namespace brenvik
