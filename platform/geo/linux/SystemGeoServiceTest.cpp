// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/SystemGeoService.h"

#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <future>
#include <limits>

#include "platform/geo/linux/PublicAddressFinder.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/runloop/fakes/ManualRunLoop.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/web/fakes/ScriptedWebClient.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

// A UDP port that takes datagrams and answers none.
struct SilentServer {
  SilentServer() : socket(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    EXPECT_EQ(::bind(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    socklen_t size = sizeof address;
    EXPECT_EQ(::getsockname(socket.get(), reinterpret_cast<sockaddr*>(&address), &size), 0);
    name = "127.0.0.1:" + std::to_string(ntohs(address.sin_port));
  }
  // To everybody else the port is closed now: a socket that is connected, here to itself, hears one peer
  // only. Its number is not free, so nobody else's server can turn up there.
  void refuse() {
    sockaddr_in own{};
    socklen_t size = sizeof own;
    ASSERT_EQ(::getsockname(socket.get(), reinterpret_cast<sockaddr*>(&own), &size), 0);
    ASSERT_EQ(::connect(socket.get(), reinterpret_cast<const sockaddr*>(&own), size), 0);
  }
  UniqueFd socket;
  std::string name;
};

class SystemGeoServiceTest : public testing::Test {
 protected:
  SystemGeoServiceTest() {
    settings.countryFiles = {"/nonexistent", "/nonexistent", "/nonexistent", "/nonexistent"};
  }

  RecordingLog log;
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemQueues queues{*loop};
  ScriptedWebClient web;
  SystemGeoService::Settings settings{"", GAZETTEER_DATABASE, "127.0.0.1:9", {}};
  std::shared_ptr<WorkQueue> handlers = queues.makeSerial("handlers", QualityOfService::standard);
};

TEST_F(SystemGeoServiceTest, AnswersOnTheGivenQueueAfterTheTicketIsGone) {
  SystemGeoService service(queues, web, settings);
  std::promise<std::string> answered;
  service.makeReverseGeocodeTicket({59.9133, 10.739}, IncludeEta::no, ShiftLocations::ifNeeded, nullptr)
      ->submit(
          [&](const std::optional<MapItems>& items, const std::optional<GeoError>& error) {
            EXPECT_TRUE(handlers->isCurrent());
            EXPECT_FALSE(error);
            answered.set_value(items.value().at(0)->address->structuredAddress->countryCode.value());
          },
          nullptr, handlers);
  EXPECT_EQ(answered.get_future().get(), "NO");
}

TEST_F(SystemGeoServiceTest, NeverAnswersFromWithinSubmit) {
  SystemGeoService service(queues, web, settings);
  std::promise<bool> answered;
  handlers->post([&] {
    bool submitted = false;
    auto done = std::make_shared<bool>(false);
    service
        .makeReverseGeocodeTicket({std::numeric_limits<double>::quiet_NaN(), 0}, IncludeEta::no,
                                  ShiftLocations::no, nullptr)
        ->submit(
            [&answered, done](const std::optional<MapItems>&, const std::optional<GeoError>& error) {
              EXPECT_TRUE(error);
              answered.set_value(*done);
            },
            nullptr, handlers);
    submitted = true;
    *done = submitted;
  });
  EXPECT_TRUE(answered.get_future().get());
}

TEST_F(SystemGeoServiceTest, TheCountryOfTheLastAnswerIsTheConfiguredOneWhenThereIsNoFile) {
  SystemGeoService service(queues, web, settings);
  EXPECT_EQ(service.currentCountryCode(), std::nullopt);
  std::promise<void> answered;
  service.makeReverseGeocodeTicket({48.8584, 2.2945}, IncludeEta::no, ShiftLocations::ifNeeded, nullptr)
      ->submit([&](const auto&, const auto&) { answered.set_value(); }, nullptr, handlers);
  answered.get_future().wait();
  EXPECT_EQ(service.currentCountryCode(), "FR");
}

TEST_F(SystemGeoServiceTest, APublicAddressThatCannotBeHadIsAnError) {
  SilentServer gone;
  gone.refuse();
  settings.stunServer = gone.name;
  SystemGeoService service(queues, web, settings);
  std::promise<std::string> answered;
  service.makeGeoIpTicket(std::nullopt)
      ->submit(
          [&](const std::optional<GeoIpResult>& result, const std::optional<GeoError>& error) {
            EXPECT_TRUE(handlers->isCurrent());
            EXPECT_FALSE(result);
            answered.set_value(error.value().description);
          },
          nullptr, nullptr, handlers);
  EXPECT_EQ(answered.get_future().get(), "the STUN server cannot be reached");
}

TEST_F(SystemGeoServiceTest, AnotherAddressThanOnesOwnIsNotLookedUp) {
  SystemGeoService service(queues, web, settings);
  std::promise<std::string> answered;
  service.makeGeoIpTicket("192.0.2.1")
      ->submit([&](const auto&,
                   const std::optional<GeoError>& error) { answered.set_value(error.value().description); },
               nullptr, nullptr, handlers);
  EXPECT_EQ(answered.get_future().get(), "only this device's own address can be looked up");
}

TEST_F(SystemGeoServiceTest, AServiceDestroyedInTheMiddleDoesNotWaitForTheNetwork) {
  SilentServer silent;
  settings.stunServer = silent.name;
  std::chrono::steady_clock::time_point before;
  {
    SystemGeoService service(queues, web, settings);
    service.makeGeoIpTicket(std::nullopt)
        ->submit([](const auto&, const auto&) { ADD_FAILURE() << "answered after its end"; }, nullptr,
                 nullptr, handlers);
    char byte = 0;
    EXPECT_EQ(::recv(silent.socket.get(), &byte, 1, 0), 1) << "the transaction has begun";
    before = std::chrono::steady_clock::now();
  }
  EXPECT_LT(std::chrono::steady_clock::now() - before, 5s);
}

TEST_F(SystemGeoServiceTest, AnAnswerWhoseQueueIsGoneIsDropped) {
  SystemGeoService service(queues, web, settings);
  auto gone = queues.makeSerial("gone", QualityOfService::standard);
  const auto ticket =
      service.makeReverseGeocodeTicket({59.9, 10.7}, IncludeEta::no, ShiftLocations::ifNeeded, nullptr);
  ticket->submit([](const auto&, const auto&) {}, nullptr, gone);
  gone.reset();
  std::promise<void> answered;
  ticket->submit([&](const auto&, const auto&) { answered.set_value(); }, nullptr, handlers);
  answered.get_future().wait();
}

TEST_F(SystemGeoServiceTest, WithoutAThreadToWorkOnQuestionsEndInAnErrorAndLaterOnesAreAnswered) {
  class QueuesThatRunOut final : public WorkQueues {
   public:
    explicit QueuesThatRunOut(WorkQueues& others) : others_(others) {}
    WorkQueue& main() noexcept override { return others_.main(); }
    WorkQueue& global() override { return others_.global(); }
    std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService qualityOfService) override {
      if (none) throw OutOfQueues();
      return others_.makeSerial(std::move(label), qualityOfService);
    }
    std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t, std::uint32_t, WorkQueue::Task,
                                                             WorkQueue::Task) override {
      return nullptr;
    }
    bool none = true;

   private:
    WorkQueues& others_;
  };
  handlers->post([] {});  // its own thread is there
  QueuesThatRunOut scarce(queues);
  SilentServer gone;
  gone.refuse();
  settings.stunServer = gone.name;
  SystemGeoService service(scarce, web, settings);
  const auto problems = [&] {
    std::promise<std::string> place;
    std::promise<std::string> address;
    service.makeReverseGeocodeTicket({59.9133, 10.739}, IncludeEta::no, ShiftLocations::ifNeeded, nullptr)
        ->submit(
            [&](const auto&, const std::optional<GeoError>& error) {
              place.set_value(error ? error->description : "none");
            },
            nullptr, handlers);
    service.makeGeoIpTicket(std::nullopt)
        ->submit(
            [&](const auto&, const std::optional<GeoError>& error) {
              address.set_value(error ? error->description : "none");
            },
            nullptr, nullptr, handlers);
    return place.get_future().get() + "; " + address.get_future().get();
  };
  EXPECT_EQ(problems(), "the geo service has no thread to work on; the geo service has no thread to work on");
  scarce.none = false;
  EXPECT_EQ(problems(), "none; the STUN server cannot be reached");
}

TEST(PublicAddressFinderTest, AQueueThatCannotStartLeavesNobodyWaiting) {
  class Reluctant final : public WorkQueue {
   public:
    const std::string& label() const noexcept override { return label_; }
    void post(Task task) override {
      if (refuses) throw OutOfQueues();
      task();
    }
    void postAfter(std::chrono::nanoseconds, Task) override {}
    std::unique_ptr<Timer> makeTimer(std::chrono::nanoseconds, std::chrono::nanoseconds,
                                     std::chrono::nanoseconds, Task) override {
      return nullptr;
    }
    bool isCurrent() const noexcept override { return false; }
    std::unique_ptr<DescriptorSource> watchDescriptor(int, std::uint32_t,
                                                      RunLoop::DescriptorHandler) override {
      return nullptr;
    }
    bool refuses = true;

   private:
    const std::string label_ = "reluctant";
  };
  class Nobody final : public StunNetwork {
   public:
    std::chrono::nanoseconds elapsed() override { return 0s; }
    std::size_t findPeers(std::chrono::nanoseconds) override { return 0; }
    bool send(std::size_t, std::span<const std::byte>) override { return false; }
    Event wait(std::chrono::nanoseconds) override { return {}; }
  };
  ManualClock clock;
  ManualWorkQueue mainQueue(clock);
  Reluctant queue;
  const auto finder =
      std::make_shared<PublicAddressFinder>([](int) { return std::make_unique<Nobody>(); }, mainQueue);
  std::vector<std::string> problems;
  const auto ask = [&] {
    finder->find([&](const StunOutcome& outcome) { problems.push_back(outcome.error.value().description); },
                 queue);
  };
  ask();
  queue.refuses = false;
  ask();
  EXPECT_EQ(problems, (std::vector<std::string>{"no thread to wait on",
                                                "the name of the STUN server cannot be resolved"}));
}

TEST(PublicAddressFinderTest, QuestionsDuringATransactionShareTheNext) {
  // A network that finds nobody, and counts how often it was made.
  class Nobody final : public StunNetwork {
   public:
    std::chrono::nanoseconds elapsed() override { return 0s; }
    std::size_t findPeers(std::chrono::nanoseconds) override {
      if (during) during();
      return 0;
    }
    bool send(std::size_t, std::span<const std::byte>) override { return false; }
    Event wait(std::chrono::nanoseconds) override { return {}; }
    std::function<void()> during;
  };
  ManualClock clock;
  ManualWorkQueue queue(clock);
  ManualWorkQueue mainQueue(clock);
  int networks = 0;
  int answers = 0;
  std::shared_ptr<PublicAddressFinder> finder;
  finder = std::make_shared<PublicAddressFinder>(
      [&](int) {
        auto network = std::make_unique<Nobody>();
        if (++networks == 1) {
          network->during = [&] {
            for (int i = 0; i < 100; ++i) finder->find([&](const StunOutcome&) { ++answers; }, queue);
          };
        }
        return network;
      },
      mainQueue);
  finder->find([&](const StunOutcome& outcome) { answers += outcome.error ? 1 : 0; }, queue);
  queue.runReady();
  EXPECT_EQ(networks, 2);
  EXPECT_EQ(answers, 101);
}

TEST(PublicAddressFinderTest, NoTransactionRunsOnTheMainQueue) {
  ManualClock clock;
  ManualWorkQueue mainQueue(clock);
  const auto finder = std::make_shared<PublicAddressFinder>(
      [](int) -> std::unique_ptr<StunNetwork> {
        ADD_FAILURE() << "would block the main loop";
        return nullptr;
      },
      mainQueue);
  std::string problem;
  finder->find([&](const StunOutcome& outcome) { problem = outcome.error.value().description; }, mainQueue);
  mainQueue.runReady();
  EXPECT_EQ(problem, "no thread to wait on");
}

}  // namespace
}  // namespace brenvik
