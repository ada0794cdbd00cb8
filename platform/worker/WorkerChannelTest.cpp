// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/worker/WorkerChannel.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/fakes/FailingAllocations.h"
#include "platform/base/fakes/LingeringSocket.h"
#include "platform/datagram/Datagram.h"
#include "platform/worker/fakes/ThreadedWorker.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

class WorkerChannelTest : public testing::Test {
 protected:
  WorkerChannelTest() { EXPECT_EQ(WorkerChannel::makePair(&one, &other), WorkerResult::done); }

  static std::vector<std::byte> bytesOf(const std::string& text) {
    const auto bytes = std::as_bytes(std::span(text));
    return {bytes.begin(), bytes.end()};
  }
  WorkerResult receiveNow(WorkerChannel& from) { return from.receive(&message, Clock::now()); }
  static bool isOpen(int fd) { return ::fcntl(fd, F_GETFD) >= 0; }

  // As another program could, past the rules of send().
  void sendRaw(std::size_t size, std::size_t descriptors) {
    const std::vector<std::byte> bytes(size);
    const std::array parts{iovecOf(bytes)};
    ASSERT_EQ(sendDatagram(one.descriptor(), parts, std::vector(descriptors, STDERR_FILENO)), 0);
  }
  static int freeDescriptor() {
    const UniqueFd next(::dup(STDERR_FILENO));
    return next.get();
  }
  // All channels of a process share the room for what waits to be closed. An earlier test may have filled it.
  static void awaitRoomToDistrust() {
    const auto end = Clock::now() + 30s;
    while (!WorkerChannel::hasRoomToDistrust() && Clock::now() < end) std::this_thread::sleep_for(10ms);
    ASSERT_TRUE(WorkerChannel::hasRoomToDistrust());
  }

  WorkerChannel one;
  WorkerChannel other;
  WorkerMessage message;
};

TEST_F(WorkerChannelTest, AMessageArrivesAsItWasSent) {
  WorkerMessage sent;
  sent.kind = 0xFEDCBA98;
  sent.payload = bytesOf("payload");
  sent.descriptors.emplace_back(::open("/dev/null", O_RDWR | O_CLOEXEC));
  ASSERT_EQ(one.send(sent), WorkerResult::done);
  ASSERT_EQ(receiveNow(other), WorkerResult::done);
  EXPECT_EQ(message.kind, 0xFEDCBA98U);
  EXPECT_EQ(message.payload, bytesOf("payload"));
  ASSERT_EQ(message.descriptors.size(), 1U);
  EXPECT_NE(::fcntl(message.descriptors[0].get(), F_GETFD) & FD_CLOEXEC, 0);
}

TEST_F(WorkerChannelTest, TheLongestMessageArrivesAndALongerOneIsNotSent) {
  WorkerMessage sent;
  sent.payload.resize(WorkerMessage::kLongestPayload);
  for (std::size_t i = 0; i < WorkerMessage::kMaxDescriptors; ++i)
    sent.descriptors.emplace_back(::dup(STDERR_FILENO));
  ASSERT_EQ(one.send(sent), WorkerResult::done);
  ASSERT_EQ(receiveNow(other), WorkerResult::done);
  EXPECT_EQ(message.payload.size(), WorkerMessage::kLongestPayload);
  EXPECT_EQ(message.descriptors.size(), WorkerMessage::kMaxDescriptors);
  sent.payload.resize(WorkerMessage::kLongestPayload + 1);
  EXPECT_EQ(one.send(sent), WorkerResult::malformed);
  sent.payload.clear();
  sent.descriptors.emplace_back(::dup(STDERR_FILENO));
  EXPECT_EQ(one.send(sent), WorkerResult::malformed);
}

TEST_F(WorkerChannelTest, WhereAShortMessageIsWaitedForALongOneIsMalformed) {
  WorkerMessage sent;
  sent.kind = 5;
  sent.payload.resize(WorkerMessage::kShortPayload, std::byte{7});
  ASSERT_EQ(one.send(sent), WorkerResult::done);
  ASSERT_EQ(other.receiveShort(&message, Clock::now()), WorkerResult::done);
  EXPECT_EQ(message.kind, 5U);
  EXPECT_EQ(message.payload, sent.payload);
  sent.payload.emplace_back();
  ASSERT_EQ(one.send(sent), WorkerResult::done);
  EXPECT_EQ(other.receiveShort(&message, Clock::now()), WorkerResult::malformed);
  EXPECT_TRUE(message.payload.empty());
  EXPECT_EQ(other.receiveShort(&message, Clock::now()), WorkerResult::timedOut);
}

TEST_F(WorkerChannelTest, NothingThereIsATimeOut) {
  EXPECT_EQ(receiveNow(other), WorkerResult::timedOut);
  const auto before = Clock::now();
  EXPECT_EQ(other.receive(&message, before + 5ms), WorkerResult::timedOut);
  EXPECT_GE(Clock::now(), before + 5ms);
}

TEST_F(WorkerChannelTest, WhoHangsUpIsNoticedAfterWhatWasSent) {
  ASSERT_EQ(one.send({.kind = 3, .payload = {}, .descriptors = {}}), WorkerResult::done);
  one.close();
  EXPECT_EQ(receiveNow(other), WorkerResult::done);
  EXPECT_EQ(receiveNow(other), WorkerResult::closed);
  EXPECT_EQ(other.receive(&message, Clock::time_point::max()), WorkerResult::closed);
  EXPECT_EQ(other.send({}), WorkerResult::closed);
  WorkerChannel none;
  EXPECT_EQ(none.send({}), WorkerResult::closed);
  EXPECT_EQ(receiveNow(none), WorkerResult::closed);
}

TEST_F(WorkerChannelTest, WhoDoesNotReadIsFullAndBlocksNobody) {
  WorkerMessage sent;
  sent.payload.resize(10'000);
  int messages = 0;
  while (one.send(sent) == WorkerResult::done) ASSERT_LT(++messages, 10'000);
  EXPECT_EQ(one.send(sent), WorkerResult::full);
  EXPECT_EQ(receiveNow(other), WorkerResult::done);
}

TEST_F(WorkerChannelTest, WhatIsNoMessageIsDroppedWithItsDescriptors) {
  const int before = freeDescriptor();
  const auto expectRefused = [&](std::size_t size, std::size_t descriptors) {
    sendRaw(size, descriptors);
    EXPECT_EQ(receiveNow(other), WorkerResult::malformed) << size << ", " << descriptors;
    EXPECT_TRUE(message.payload.empty());
    EXPECT_TRUE(message.descriptors.empty());
    EXPECT_EQ(freeDescriptor(), before);
  };
  expectRefused(3, 0);
  expectRefused(3, 1);
  expectRefused(8, 5);
  expectRefused(8, 253);
  expectRefused(WorkerMessage::kLongestPayload + 5, 1);
  sendRaw(4, 4);
  EXPECT_EQ(receiveNow(other), WorkerResult::done);
  EXPECT_EQ(message.descriptors.size(), 4U);
}

TEST_F(WorkerChannelTest, WithoutDescriptorsTheyAreALackOfThisProcess) {
  sendRaw(8, 3);
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
  const rlimit none{0, before.rlim_max};
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
  const WorkerResult result = receiveNow(other);
  WorkerChannel a;
  WorkerChannel b;
  const WorkerResult pair = WorkerChannel::makePair(&a, &b);
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
  EXPECT_EQ(result, WorkerResult::outOfMemory);
  EXPECT_EQ(pair, WorkerResult::outOfMemory);
}

TEST_F(WorkerChannelTest, WithoutMemoryForAllOfItNothingOfAMessageIsThere) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "ThreadSanitizer needs its own operator new";
  WorkerMessage sent;
  sent.payload = bytesOf("payload");
  sent.descriptors.emplace_back(::dup(STDERR_FILENO));
  WorkerResult result = WorkerResult::outOfMemory;
  int lacks = 0;
  while (lacks < 10 && result == WorkerResult::outOfMemory) {
    ASSERT_EQ(one.send(sent), WorkerResult::done);
    message = {};
    {
      const FailingAllocations failing(lacks);
      result = receiveNow(other);
    }
    if (result != WorkerResult::outOfMemory) break;
    EXPECT_TRUE(message.payload.empty()) << lacks;
    EXPECT_TRUE(message.descriptors.empty()) << lacks;
    ++lacks;
  }
  EXPECT_EQ(result, WorkerResult::done);
  EXPECT_EQ(lacks, 2) << "for the payload, and for the descriptors";
  EXPECT_EQ(message.payload, sent.payload);
}

// What a hostile peer sends: each leaves the descriptor to be closed by the receiver in another way.
class DistrustedChannelTest : public WorkerChannelTest, public testing::WithParamInterface<int> {};

TEST_P(DistrustedChannelTest, ADescriptorWhoseCloseWaitsKeepsNobodyWaiting) {
  awaitRoomToDistrust();
  LingeringSocket lingering(2);
  other.distrust();
  WorkerMessage sent;
  sent.descriptors.push_back(std::move(lingering.socket));
  if (GetParam() == 0) {  // unread, behind an empty datagram
    ASSERT_EQ(::send(one.descriptor(), "", 0, 0), 0);
  }
  ASSERT_EQ(one.send(sent), WorkerResult::done);
  if (GetParam() == 1) {  // with what is no message
    WorkerMessage more;
    more.payload.resize(1);
    const int fd = sent.descriptors[0].get();
    (void)receiveNow(other);
    message.descriptors.clear();  // here, and not elsewhere and later: the next close is the last
    const std::byte byte{};
    const std::array parts{iovecOf(std::span(&byte, 1))};
    ASSERT_EQ(sendDatagram(one.descriptor(), parts, std::span(&fd, 1)), 0);
  }
  sent.descriptors[0].reset();  // the last one is on its way now
  const auto before = Clock::now();
  if (GetParam() == 1) {
    EXPECT_EQ(receiveNow(other), WorkerResult::malformed);
  } else if (GetParam() == 2) {  // with a message that nobody asked for
    EXPECT_EQ(receiveNow(other), WorkerResult::done);
    other.discard(&message);
  }
  other.close();
  EXPECT_LT(Clock::now() - before, 1s);
}

INSTANTIATE_TEST_SUITE_P(Ways, DistrustedChannelTest, testing::Values(0, 1, 2));

TEST_F(WorkerChannelTest, AFloodOfDescriptorsWhoseCloseWaitsIsNotReceivedAnyMore) {
  awaitRoomToDistrust();
  other.distrust();
  std::vector<LingeringSocket> waiting;
  for (int i = 0; i < 20; ++i) waiting.emplace_back(2);
  const auto before = Clock::now();
  for (LingeringSocket& each : waiting) {
    WorkerMessage sent;
    sent.descriptors.push_back(std::move(each.socket));
    ASSERT_EQ(one.send(sent), WorkerResult::done);
    sent.descriptors.clear();  // the last one is on its way now
    ASSERT_EQ(receiveNow(other), WorkerResult::done);
    other.discard(&message);
  }
  // Behind those, which take two seconds, others pile up.
  WorkerResult received = WorkerResult::malformed;
  int floods = 0;
  for (; floods < 10 && received == WorkerResult::malformed; ++floods) {
    sendRaw(8, 253);
    received = receiveNow(other);
  }
  EXPECT_EQ(received, WorkerResult::unavailable);
  EXPECT_GE(floods, 2);
  // What is unread is closed elsewhere as well.
  LingeringSocket lingering(2);
  WorkerMessage sent;
  sent.descriptors.push_back(std::move(lingering.socket));
  ASSERT_EQ(one.send(sent), WorkerResult::done);
  sent.descriptors.clear();
  other.close();
  EXPECT_LT(Clock::now() - before, 1900ms);
}

TEST(ThreadedWorkerTest, ChannelsAreServedAndHangUpWithTheWorker) {
  ThreadedWorker worker([](std::uint32_t work, WorkerChannel channel) {
    WorkerMessage message;
    while (channel.receive(&message, Clock::time_point::max()) == WorkerResult::done) {
      message.kind += work;
      (void)channel.send(message);
    }
  });
  WorkerChannel first;
  WorkerChannel second;
  ASSERT_EQ(worker.open(100, &first), WorkerResult::done);
  ASSERT_EQ(worker.open(200, &second), WorkerResult::done);
  WorkerMessage message;
  for (int i = 0; i < 3; ++i) {
    ASSERT_EQ(first.send({.kind = 1, .payload = {}, .descriptors = {}}), WorkerResult::done);
    ASSERT_EQ(first.receive(&message, Clock::now() + 10s), WorkerResult::done);
    EXPECT_EQ(message.kind, 101U);
  }
  worker.giveUp(&first);
  EXPECT_EQ(second.receive(&message, Clock::now() + 10s), WorkerResult::closed);
  worker.giveUp(&second);
  EXPECT_EQ(worker.givenUp(), 1) << "the other one was of a worker that is gone";
}

}  // namespace
}  // namespace brenvik
