// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/linux/StunTransaction.h"

#include <gtest/gtest.h>

#include <functional>
#include <map>

#include "platform/log/fakes/RecordingLog.h"
#include "platform/runloop/fakes/ManualRunLoop.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
using std::chrono::nanoseconds;
using Event = StunNetwork::Event;

constexpr StunTransactionId kId{std::byte{1}, std::byte{2}, std::byte{3}};

std::vector<std::byte> answerFor(std::span<const std::byte> request) {
  std::vector<std::byte> answer(request.begin(), request.end());
  answer[0] = answer[1] = std::byte{1};
  answer[3] = std::byte{12};
  for (const int byte : {0x00, 0x20, 0x00, 0x08, 0x00, 0x01, 0xa1, 0x47, 0xe1, 0x12, 0xa6, 0x43}) {
    answer.push_back(static_cast<std::byte>(byte));
  }
  return answer;
}
std::vector<std::byte> refusalFor(std::span<const std::byte> request) {
  std::vector<std::byte> answer(request.begin(), request.end());
  answer[0] = std::byte{0x01};
  answer[1] = std::byte{0x11};
  return answer;
}

// A network on a manual clock: what arrives is scheduled there, and waiting is what moves the time.
class ManualStunNetwork final : public StunNetwork {
 public:
  struct Sent {
    nanoseconds at;
    std::size_t peer;
    bool operator==(const Sent&) const = default;
  };

  nanoseconds elapsed() override { return clock.now(); }
  std::size_t findPeers(nanoseconds until) override {
    patienceOfLookUp = until;
    clock.advance(lookUpTakes);
    return peers;
  }
  bool send(std::size_t peer, std::span<const std::byte> datagram) override {
    EXPECT_EQ(std::vector(datagram.begin(), datagram.end()),
              std::vector<std::byte>(request.begin(), request.end()));
    sent.push_back({clock.now(), peer});
    return !unreachable.contains(peer);
  }
  Event wait(nanoseconds until) override {
    ++waits;
    while (events.empty() && clock.now() < until) {
      // A step at a time, so that an event ends the waiting at its own moment.
      clock.advance(std::min<nanoseconds>(1ms, until - clock.now()));
    }
    if (events.empty()) return {};
    auto event = std::move(events.front());
    events.erase(events.begin());
    return event;
  }

  void arrivesAt(nanoseconds at, Event event) {
    clock.schedule(at - clock.now(), [this, event] { events.push_back(event); });
  }
  void answersAt(nanoseconds at, std::size_t peer = 0) {
    arrivesAt(at, {Event::Kind::datagram, peer, answerFor(request)});
  }
  void failsAt(nanoseconds at, std::size_t peer = 0) { arrivesAt(at, {Event::Kind::peerFailed, peer, {}}); }

  ManualClock clock;
  std::size_t peers = 1;
  nanoseconds lookUpTakes{0};
  nanoseconds patienceOfLookUp{0};
  std::map<std::size_t, bool> unreachable;
  std::vector<Event> events;
  std::vector<Sent> sent;
  int waits = 0;
  const StunRequest request = makeStunBindingRequest(kId);
};
using Sent = ManualStunNetwork::Sent;
using SentAll = std::vector<Sent>;

class StunTransactionTest : public testing::Test {
 protected:
  StunOutcome run() { return runStunTransaction(network, kId); }
  static std::string problemOf(const StunOutcome& outcome) {
    EXPECT_FALSE(outcome.address);
    return outcome.error ? outcome.error->description : "none";
  }
  ManualStunNetwork network;
  RecordingLog log;
};

TEST_F(StunTransactionTest, AnAnswerToTheFirstSendingEndsIt) {
  network.answersAt(30ms);
  EXPECT_EQ(run().address, "192.0.2.1");
  EXPECT_EQ(network.sent, (SentAll{{0ms, 0}}));
  EXPECT_EQ(network.clock.now(), 30ms);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(StunTransactionTest, WithoutAnswerItIsSentFiveTimesAndGivenUpAfterSevenAndThreeQuarterSeconds) {
  EXPECT_EQ(problemOf(run()), "the STUN server does not answer");
  EXPECT_EQ(network.sent, (SentAll{{0ms, 0}, {250ms, 0}, {750ms, 0}, {1750ms, 0}, {3750ms, 0}}));
  EXPECT_EQ(network.clock.now(), 7750ms);
  EXPECT_EQ(network.patienceOfLookUp, 7750ms);
}

TEST_F(StunTransactionTest, AnAnswerInTheLastMomentStillCounts) {
  network.answersAt(7749ms);
  EXPECT_EQ(run().address, "192.0.2.1");
}

TEST_F(StunTransactionTest, SendingsThatFellDueDuringASlowLookUpAreOne) {
  network.lookUpTakes = 800ms;
  network.answersAt(2s);
  EXPECT_EQ(run().address, "192.0.2.1");
  EXPECT_EQ(network.sent, (SentAll{{800ms, 0}, {1750ms, 0}}));
}

TEST_F(StunTransactionTest, ALookUpThatTakesAllTheTimeLeavesNoneForSending) {
  network.lookUpTakes = 7750ms;
  EXPECT_EQ(problemOf(run()), "the STUN server does not answer");
  EXPECT_TRUE(network.sent.empty());
}

TEST_F(StunTransactionTest, ANameWithoutAddressEndsItAtOnce) {
  network.peers = 0;
  EXPECT_EQ(problemOf(run()), "the name of the STUN server cannot be resolved");
  EXPECT_EQ(network.waits, 0);
}

TEST_F(StunTransactionTest, ARefusedConnectionEndsItAtOnce) {
  network.failsAt(2ms);
  EXPECT_EQ(problemOf(run()), "the STUN server cannot be reached");
  EXPECT_EQ(network.clock.now(), 2ms);
}

TEST_F(StunTransactionTest, AServerThatCannotBeSentToEndsItAtOnce) {
  network.unreachable[0] = true;
  EXPECT_EQ(problemOf(run()), "the STUN server cannot be reached");
  EXPECT_EQ(network.waits, 0);
}

TEST_F(StunTransactionTest, AnErrorResponseEndsIt) {
  network.arrivesAt(5ms, {Event::Kind::datagram, 0, refusalFor(network.request)});
  EXPECT_EQ(problemOf(run()), "the STUN server refuses");
  EXPECT_EQ(network.clock.now(), 5ms);
}

TEST_F(StunTransactionTest, ASuccessWithoutAnAddressEndsItAtOnce) {
  auto answer = answerFor(network.request);
  answer.resize(20);
  answer[3] = std::byte{0};
  network.arrivesAt(5ms, {Event::Kind::datagram, 0, answer});
  EXPECT_EQ(problemOf(run()), "the STUN server's answer has no address");
  EXPECT_EQ(network.clock.now(), 5ms);
  EXPECT_TRUE(log.entries().empty());
}

TEST_F(StunTransactionTest, AnAnswerThatMustNotBeUnderstoodIsDiscardedAndTheNextOneCounts) {
  auto answer = answerFor(network.request);
  answer[3] = std::byte{16};
  for (const int byte : {0x7f, 0xff, 0x00, 0x00}) answer.push_back(static_cast<std::byte>(byte));
  network.arrivesAt(5ms, {Event::Kind::datagram, 0, answer});
  network.answersAt(10ms);
  EXPECT_EQ(run().address, "192.0.2.1");
  EXPECT_EQ(network.clock.now(), 10ms);
}

TEST_F(StunTransactionTest, WrongAnswersAreIgnoredAndSaidOnce) {
  auto wrong = answerFor(network.request);
  wrong[19] ^= std::byte{1};
  for (int i = 1; i <= 100; ++i) network.arrivesAt(i * 1ms, {Event::Kind::datagram, 0, wrong});
  network.arrivesAt(101ms, {Event::Kind::datagram, 0, {}});
  network.answersAt(102ms);
  EXPECT_EQ(run().address, "192.0.2.1");
  EXPECT_EQ(network.sent.size(), 1U);
  EXPECT_EQ(log.entries().size(), 1U);
}

TEST_F(StunTransactionTest, AStreamOfWrongAnswersDoesNotPutOffTheEnd) {
  for (int i = 0; i < 8000; ++i) network.arrivesAt(i * 1ms, {Event::Kind::datagram, 0, {}});
  EXPECT_EQ(problemOf(run()), "the STUN server does not answer");
  EXPECT_EQ(network.sent.size(), 5U);
  EXPECT_LE(network.clock.now(), 7752ms);
}

TEST_F(StunTransactionTest, StoppingEndsIt) {
  network.arrivesAt(1s, {Event::Kind::stopped, 0, {}});
  EXPECT_EQ(problemOf(run()), "the geo service is stopping");
  EXPECT_EQ(network.clock.now(), 1s);
}

TEST_F(StunTransactionTest, ThePreferredPeerIsAskedAloneAtFirst) {
  network.peers = 2;
  network.answersAt(100ms, 0);
  EXPECT_EQ(run().address, "192.0.2.1");
  EXPECT_EQ(network.sent, (SentAll{{0ms, 0}}));
}

TEST_F(StunTransactionTest, TheOtherPeerIsAskedFromTheSecondSendingOn) {
  network.peers = 2;
  network.answersAt(300ms, 1);
  EXPECT_EQ(run().address, "192.0.2.1");
  EXPECT_EQ(network.sent, (SentAll{{0ms, 0}, {250ms, 0}, {250ms, 1}}));
}

TEST_F(StunTransactionTest, TheOtherPeerIsAskedAtOnceWhenThePreferredOneFails) {
  network.peers = 2;
  network.failsAt(5ms, 0);
  network.answersAt(10ms, 1);
  EXPECT_EQ(run().address, "192.0.2.1");
  EXPECT_EQ(network.sent, (SentAll{{0ms, 0}, {5ms, 1}}));
}

TEST_F(StunTransactionTest, TheOtherPeerIsAskedAtOnceWhenThePreferredOneCannotBeSentTo) {
  network.peers = 2;
  network.unreachable[0] = true;
  network.answersAt(10ms, 1);
  EXPECT_EQ(run().address, "192.0.2.1");
  EXPECT_EQ(network.sent, (SentAll{{0ms, 0}, {0ms, 1}}));
}

TEST_F(StunTransactionTest, ItEndsWhenTheLastPeerHasFailed) {
  network.peers = 2;
  network.failsAt(5ms, 0);
  network.failsAt(10ms, 1);
  EXPECT_EQ(problemOf(run()), "the STUN server cannot be reached");
  EXPECT_EQ(network.clock.now(), 10ms);
}

}  // namespace
}  // namespace brenvik
