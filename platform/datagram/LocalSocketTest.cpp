// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/datagram/LocalSocket.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <string>

namespace brenvik {
namespace {

constexpr std::size_t kLongest = sizeof(sockaddr_un::sun_path) - 1;

TEST(LocalSocketTest, APathFitsWithTheByteThatEndsIt) {
  const std::string longest(kLongest, 'x');
  ASSERT_TRUE(socketAddress(longest));
  EXPECT_EQ(socketAddress(longest)->sun_path, longest);
  EXPECT_FALSE(socketAddress(longest + "x"));
  EXPECT_FALSE(socketAddress(""));
}

TEST(LocalSocketTest, FolderAndNameMakeAPath) {
  const auto address = socketAddress("/run/folder", "name");
  ASSERT_TRUE(address);
  EXPECT_EQ(address->sun_family, AF_UNIX);
  EXPECT_STREQ(address->sun_path, "/run/folder/name");
  EXPECT_TRUE(socketAddress(std::string(kLongest - 5, 'x'), "name"));
  EXPECT_FALSE(socketAddress(std::string(kLongest - 4, 'x'), "name"));
  EXPECT_FALSE(socketAddress(std::string(1000, 'x'), std::string(1000, 'x')));
}

TEST(LocalSocketTest, OnlyOneKindOfSocketIsAChannel) {
  UniqueFd one;
  UniqueFd other;
  ASSERT_EQ(makeSocketPair(&one, &other), 0);
  EXPECT_TRUE(isLocalSocket(one.get()));
  EXPECT_TRUE(isLocalSocket(one.get(), Listening::no));
  EXPECT_FALSE(isLocalSocket(one.get(), Listening::yes));
  const UniqueFd stream(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const UniqueFd network(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  const UniqueFd file(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  for (const int each : {stream.get(), network.get(), file.get(), -1}) EXPECT_FALSE(isLocalSocket(each));
}

TEST(LocalSocketTest, AListeningSocketAndWhoConnects) {
  const UniqueFd listening = makeSocket(Blocking::no);
  // An abstract name: no file stays behind.
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  ("local-socket-test-" + std::to_string(::getpid())).copy(address.sun_path + 1, sizeof address.sun_path - 2);
  ASSERT_EQ(bindSocket(listening.get(), address), 0);
  EXPECT_FALSE(isLocalSocket(listening.get(), Listening::yes));
  ASSERT_EQ(::listen(listening.get(), 1), 0);
  EXPECT_TRUE(isLocalSocket(listening.get(), Listening::yes));
  EXPECT_FALSE(isLocalSocket(listening.get(), Listening::no));

  const UniqueFd connected = makeSocket(Blocking::yes);
  ASSERT_EQ(connectSocket(connected.get(), address), 0);
  const auto peer = peerOf(connected.get());
  ASSERT_TRUE(peer);
  EXPECT_EQ(peer->pid, ::getpid());
  EXPECT_FALSE(peerOf(-1));
}

TEST(LocalSocketTest, WhatLiesUnreadShowsEvenWhenItIsEmpty) {
  for (const char* const message : {"", "text"}) {
    UniqueFd ours;
    UniqueFd theirs;
    ASSERT_EQ(makeSocketPair(&ours, &theirs), 0);
    ASSERT_TRUE(askForCredentials(ours.get()));
    ASSERT_EQ(::send(theirs.get(), message, std::string(message).size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(std::string(message).size()));
    theirs.reset();
    EXPECT_FALSE(isDrained(ours.get())) << '"' << message << '"';
    char byte = 0;
    (void)::recv(ours.get(), &byte, sizeof byte, MSG_TRUNC);
    EXPECT_TRUE(isDrained(ours.get()));
  }
  EXPECT_FALSE(isDrained(-1));
}

}  // namespace
}  // namespace brenvik
