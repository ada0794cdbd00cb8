// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/SystemGeoService.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <future>
#include <limits>
#include <mutex>
#include <set>

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
  RecordingLog log;
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemQueues queues{*loop};
  ScriptedWebClient web;
  SystemGeoService::Settings settings{"", GAZETTEER_DATABASE, "127.0.0.1:9"};
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

TEST_F(SystemGeoServiceTest, EachTicketForThePublicAddressGoesOutAtOnce) {
  SilentServer silent;
  const timeval patience{5, 0};  // a transaction that is not answered takes longer
  ASSERT_EQ(::setsockopt(silent.socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience), 0);
  settings.stunServer = silent.name;
  SystemGeoService service(queues, web, settings);
  const auto ask = [&] {
    service.makeGeoIpTicket(std::nullopt)
        ->submit([](const auto&, const auto&) {}, nullptr, nullptr, handlers);
  };
  ask();
  ask();
  std::set<std::vector<char>> requests;
  int sendingsOfTheFirst = 0;
  while (requests.size() < 2) {
    std::vector<char> request(100);
    const auto size = ::recv(silent.socket.get(), request.data(), request.size(), 0);
    ASSERT_GT(size, 0) << "the second waits for the first";
    request.resize(static_cast<std::size_t>(size));
    requests.insert(request);  // one that is sent again is the same
    if (requests.size() == 1 && ++sendingsOfTheFirst > 5) break;
  }
  EXPECT_EQ(requests.size(), 2U);
  EXPECT_LE(sendingsOfTheFirst, 4) << "the fifth is the last";
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

// ---- transactions -----------------------------------------------------------------------------------------

// A network whose server's name has no address. That is found out once `go` says so.
class NobodyOnceTold final : public StunNetwork {
 public:
  explicit NobodyOnceTold(std::shared_future<void> go) : go_(std::move(go)) {}
  std::chrono::nanoseconds elapsed() override { return 0s; }
  std::size_t findPeers(std::chrono::nanoseconds) override {
    go_.wait();
    return 0;
  }
  bool send(std::size_t, std::span<const std::byte>) override { return false; }
  Event wait(std::chrono::nanoseconds) override { return {}; }

 private:
  const std::shared_future<void> go_;
};

class PublicAddressFinderTest : public testing::Test {
 protected:
  // Counts the transactions and, where `untilAllRun` is set, holds them until so many have begun.
  std::unique_ptr<StunNetwork> makeNetwork() {
    if (++transactions == untilAllRun) go.set_value();
    return std::make_unique<NobodyOnceTold>(gone);
  }
  void ask(PublicAddressFinder& finder) {
    finder.find([this](const StunOutcome& outcome) {
      const std::lock_guard lock(mutex);
      problems.push_back(outcome.error.value().description);
      answered.notify_all();
    });
  }
  // False when they have not come after a while.
  bool haveCome(std::size_t answers) {
    std::unique_lock lock(mutex);
    return answered.wait_for(lock, 10s, [&] { return problems.size() >= answers; });
  }
  std::shared_ptr<PublicAddressFinder> make(WorkQueues& workQueues) {
    return std::make_shared<PublicAddressFinder>([this](int) { return makeNetwork(); }, workQueues);
  }

  std::promise<void> go;
  std::shared_future<void> gone = go.get_future().share();
  std::atomic<int> transactions = 0;
  int untilAllRun = 0;
  std::mutex mutex;
  std::condition_variable answered;
  std::vector<std::string> problems;
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemQueues queues{*loop};
};

TEST_F(PublicAddressFinderTest, AQuestionDoesNotWaitForTheTransactionOfAnother) {
  untilAllRun = 3;
  const auto finder = make(queues);
  for (int i = 0; i < untilAllRun; ++i) ask(*finder);
  const bool allRun = gone.wait_for(10s) == std::future_status::ready;
  EXPECT_TRUE(allRun) << "each of them ends when all have begun";
  if (!allRun) go.set_value();
  EXPECT_TRUE(haveCome(3));
  EXPECT_EQ(transactions, 3);
  finder->stop();
}

TEST_F(PublicAddressFinderTest, OfAFloodOfQuestionsTheLaterOnesShareATransaction) {
  const auto finder = make(queues);
  for (int i = 0; i < 100; ++i) ask(*finder);
  go.set_value();
  EXPECT_TRUE(haveCome(100));
  EXPECT_EQ(transactions, static_cast<int>(PublicAddressFinder::kMaxTransactions));
  ask(*finder);
  EXPECT_TRUE(haveCome(101));
  EXPECT_EQ(transactions, static_cast<int>(PublicAddressFinder::kMaxTransactions) + 1) << "nothing is kept";
  finder->stop();
}

TEST_F(PublicAddressFinderTest, AFinderThatIsStoppedDeliversNothing) {
  const auto finder = make(queues);
  ask(*finder);
  go.set_value();
  finder->stop();
  const auto delivered = problems.size();
  EXPECT_LE(delivered, 1U) << "it may have been faster";
  ask(*finder);
  EXPECT_EQ(problems.size(), delivered);
}

// Queues that can no longer be had, or whose thread no longer starts, when the test says so.
class ScarceQueues final : public WorkQueues {
 public:
  explicit ScarceQueues(ManualClock& clock) : clock_(clock) {}
  WorkQueue& main() noexcept override { return main_; }
  WorkQueue& global() override { return main_; }
  std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService qualityOfService) override {
    if (none) throw OutOfQueues();
    EXPECT_EQ(qualityOfService, QualityOfService::standard);
    made.push_back(std::make_shared<Queue>(*this, clock_, std::move(label)));
    return made.back();
  }
  std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t, std::uint32_t, WorkQueue::Task,
                                                           WorkQueue::Task) override {
    return nullptr;
  }

  class Queue final : public WorkQueue {
   public:
    Queue(ScarceQueues& owner, ManualClock& clock, std::string label)
        : owner_(owner), real(clock, std::move(label)) {}
    const std::string& label() const noexcept override { return real.label(); }
    void post(Task task) override {
      if (owner_.noThread) throw OutOfQueues();
      real.post(std::move(task));
    }
    void postAfter(std::chrono::nanoseconds delay, Task task) override {
      real.postAfter(delay, std::move(task));
    }
    std::unique_ptr<Timer> makeTimer(std::chrono::nanoseconds, std::chrono::nanoseconds,
                                     std::chrono::nanoseconds, Task) override {
      return nullptr;
    }
    bool isCurrent() const noexcept override { return real.isCurrent(); }
    std::unique_ptr<DescriptorSource> watchDescriptor(int, Interest, RunLoop::DescriptorHandler) override {
      return nullptr;
    }

   private:
    ScarceQueues& owner_;

   public:
    ManualWorkQueue real;
  };

  bool none = false;
  bool noThread = false;
  std::vector<std::shared_ptr<Queue>> made;

 private:
  ManualClock& clock_;
  ManualWorkQueue main_{clock_, "main"};
};

TEST_F(PublicAddressFinderTest, WithoutAThreadNobodyIsLeftWaitingAndALaterQuestionIsAnswered) {
  ManualClock clock;
  ScarceQueues scarce(clock);
  go.set_value();
  const auto finder = make(scarce);
  scarce.none = true;
  ask(*finder);
  scarce.none = false;
  scarce.noThread = true;
  ask(*finder);
  EXPECT_EQ(problems, (std::vector<std::string>(2, "the geo service has no thread to work on")));
  scarce.noThread = false;
  ask(*finder);
  ASSERT_EQ(scarce.made.size(), 1U);
  scarce.made[0]->real.runReady();
  ASSERT_EQ(problems.size(), 3U);
  EXPECT_EQ(problems[2], "the name of the STUN server cannot be resolved");
}

TEST_F(PublicAddressFinderTest, WhereThereIsNoThreadForAnotherTransactionTheLastThatBeganIsShared) {
  ManualClock clock;
  ScarceQueues scarce(clock);
  go.set_value();
  const auto finder = make(scarce);
  ask(*finder);
  ask(*finder);
  scarce.none = true;
  ask(*finder);
  ASSERT_EQ(scarce.made.size(), 2U);
  EXPECT_EQ(scarce.made[1]->label(), "geo service: address");
  scarce.made[1]->real.runReady();
  EXPECT_EQ(problems, (std::vector<std::string>(2, "the name of the STUN server cannot be resolved")));
  EXPECT_EQ(transactions, 1);
  scarce.made[0]->real.runReady();
  EXPECT_EQ(problems.size(), 3U);
  EXPECT_EQ(transactions, 2);
}

TEST_F(PublicAddressFinderTest, WithoutDescriptorsTheReserveHoldsItsTransactionsBesideEveryOtherQueue) {
  untilAllRun = static_cast<int>(PublicAddressFinder::kMaxTransactions);
  const auto finder = make(queues);
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
  const rlimit few{256, before.rlim_max};
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &few), 0);
  std::vector<UniqueFd> all;
  do {
    all.emplace_back(::fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 0));
  } while (all.back().isValid());
  std::vector<std::shared_ptr<WorkQueue>> others;
  for (const char* const label :
       {"GEO callback queue", "geo service: places", "LASDUpdater", "com.norvale.httpdownloadqueue",
        "HTTP client", "com.norvale.otaheartbeat", "RadioManagerLogs", "global"}) {
    others.push_back(queues.makeSerial(label, QualityOfService::standard));
  }
  for (int i = 0; i < untilAllRun; ++i) ask(*finder);
  const bool allRun = gone.wait_for(10s) == std::future_status::ready;
  EXPECT_TRUE(allRun);
  if (!allRun) go.set_value();
  EXPECT_TRUE(haveCome(static_cast<std::size_t>(untilAllRun)));
  EXPECT_EQ(transactions, untilAllRun);
  finder->stop();
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
}

}  // namespace
}  // namespace brenvik
