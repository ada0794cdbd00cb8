// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/ClosingLine.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstring>
#include <thread>

#include "platform/base/fakes/LingeringSocket.h"
#include "platform/datagram/Datagram.h"
#include "platform/ipc/linux/IncomingMessage.h"
#include "platform/ipc/linux/SystemPortSpace.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

std::pair<UniqueFd, UniqueFd> pair() {
  std::array<int, 2> ends{};
  EXPECT_EQ(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends.data()), 0);
  return {UniqueFd(ends[0]), UniqueFd(ends[1])};
}

bool hasHungUp(const UniqueFd& fd) {
  pollfd state{fd.get(), 0, 0};
  return ::poll(&state, 1, 0) == 1;
}

bool send(const UniqueFd& socket, int descriptor, std::size_t bytes = 1) {
  const std::byte byte{'x'};
  const std::array parts{iovecOf(std::span(&byte, bytes))};
  return sendDatagram(socket.get(), parts, std::span(&descriptor, 1)) == 0;
}

TEST(ClosingLineTest, ClosesWhatItIsGiven) {
  ClosingLine line;
  auto [kept, given] = pair();
  line.close(std::move(given), 1);
  line.drain();
  EXPECT_TRUE(hasHungUp(kept));
}

TEST(ClosingLineTest, TheEndWaitsForWhatIsLeft) {
  auto [kept, given] = pair();
  {
    ClosingLine line;
    line.close(std::move(given), 1);
  }
  EXPECT_TRUE(hasHungUp(kept));
}

TEST(ClosingLineTest, OneMessageIsDroppedWithItsDescriptorsAndTheTokenIsTold) {
  ClosingLine line;
  auto [sender, receiver] = pair();
  auto [kept, given] = pair();
  ASSERT_TRUE(send(sender, given.get()));
  ASSERT_EQ(::send(sender.get(), "next", 4, 0), 4);
  given.reset();
  EXPECT_EQ(line.readable(), -1);
  const auto shared = std::make_shared<const UniqueFd>(std::move(receiver));
  ASSERT_TRUE(line.discardMessage(shared, 1, 42));
  line.drain();
  EXPECT_TRUE(hasHungUp(kept));
  pollfd told{line.readable(), POLLIN, 0};
  EXPECT_EQ(::poll(&told, 1, 0), 1);
  EXPECT_EQ(line.takeDiscarded(), std::vector<std::uint64_t>{42});
  EXPECT_EQ(::poll(&told, 1, 0), 0);
  std::array<char, 8> next{};
  EXPECT_EQ(::recv(shared->get(), next.data(), next.size(), MSG_DONTWAIT), 4);
}

TEST(ClosingLineTest, ASocketThatLingersForAnHourHoldsUpNobody) {
  ClosingLine line;
  const auto started = Clock::now();
  auto [kept, given] = pair();
  LingeringSocket direct;
  LingeringSocket inside;
  auto [sender, receiver] = pair();
  ASSERT_TRUE(send(sender, inside.socket.get()));
  inside.socket.reset();
  line.close(std::move(direct.socket), 1);
  line.close(std::move(receiver), 1);  // with the other one in its queue
  line.close(std::move(given), 2);
  while (!hasHungUp(kept)) std::this_thread::yield();
  EXPECT_LT(Clock::now() - started, 10s) << "another account's job waits for neither";
  line.drain();
  EXPECT_LT(Clock::now() - started, 60s) << "both are interrupted";
}

TEST(ClosingLineTest, AnAccountsNextJobWaitsForItsFirstAndKeepsNoThread) {
  ClosingLine line;
  const auto started = Clock::now();
  auto [kept, given] = pair();
  LingeringSocket first;
  const int number = first.socket.get();
  line.close(std::move(first.socket), 1);
  while (::fcntl(number, F_GETFD) >= 0) std::this_thread::yield();  // the number goes before the waiting
  line.close(std::move(given), 1);
  while (!hasHungUp(kept)) std::this_thread::yield();
  EXPECT_GT(Clock::now() - started, 50ms) << "it did not wait for the lingering to be interrupted";
}

TEST(ClosingLineTest, AFullLineTakesNoMoreAndClosesOnTheCallersThread) {
  ClosingLine line;
  EXPECT_TRUE(line.hasRoomFor(ClosingLine::kCapacity));
  EXPECT_FALSE(line.hasRoomFor(ClosingLine::kCapacity + 1));
  std::vector<std::pair<UniqueFd, UniqueFd>> many;
  for (std::size_t i = 0; i < 2 * ClosingLine::kCapacity; ++i) {
    auto [kept, given] = pair();
    line.close(std::move(given), 1);
    if (i % 16 == 0) many.emplace_back(std::move(kept), UniqueFd());
  }
  line.drain();
  for (const auto& [kept, none] : many) EXPECT_TRUE(hasHungUp(kept));
}

TEST(ClosingLineTest, TwoAccountsThatComeBeforeTheFirstThreadRunsHaveAThreadEach) {
  ClosingLine line;
  std::array<LingeringSocket, 8> busy;  // 100 ms each
  auto [first, lastOfFirst] = pair();
  auto [second, ofSecond] = pair();
  for (LingeringSocket& each : busy) line.close(std::move(each.socket), 1);
  line.close(std::move(lastOfFirst), 1);
  line.close(std::move(ofSecond), 2);
  while (!hasHungUp(second)) std::this_thread::yield();
  EXPECT_FALSE(hasHungUp(first)) << "the second account waited for the first";
  line.drain();
}

TEST(ClosingLineTest, WhatAStrangerSendsWithAnEmptyMessageWaitsForNothingOfTheClients) {
  SystemPortSpace ports;
  IncomingMessage incoming(ports);
  std::array<LingeringSocket, 8> busy;  // 100 ms each
  for (LingeringSocket& each : busy) ports.closing().close(std::move(each.socket), ClosingLine::kClients);
  auto [clients, last] = pair();
  ports.closing().close(std::move(last), ClosingLine::kClients);

  auto [sender, receiver] = pair();
  auto [kept, given] = pair();
  ASSERT_TRUE(send(sender, given.get(), 0));
  given.reset();
  ASSERT_EQ(incoming.peek(receiver.get(), 1), IncomingMessage::Received::endOfChannel);
  ports.closing().close(std::move(receiver), 1);
  while (!hasHungUp(kept)) std::this_thread::yield();
  EXPECT_FALSE(hasHungUp(clients)) << "it was closed in the name of the clients";
  ports.closing().drain();
}

}  // namespace
}  // namespace brenvik
