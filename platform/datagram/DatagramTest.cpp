// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/datagram/Datagram.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <string_view>
#include <vector>

#include "platform/datagram/LocalSocket.h"

namespace brenvik {
namespace {

class DatagramTest : public testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(makeSocketPair(&ours, &theirs), 0); }

  int send(std::string_view text, const std::vector<int>& passed = {}) {
    const std::array parts{iovecOf(std::as_bytes(std::span(text)))};
    return sendDatagram(ours.get(), parts, passed);
  }
  int receive(int flags = MSG_DONTWAIT) {
    const iovec room{bytes.data(), bytes.size()};
    return receiveDatagram(theirs.get(), std::span(&room, 1), control.bytes, descriptors, flags, &received);
  }
  std::string_view text() const { return {bytes.data(), received.length}; }
  static std::size_t openDescriptors() {
    std::size_t count = 0;
    for ([[maybe_unused]] const auto& each : std::filesystem::directory_iterator("/proc/self/fd")) ++count;
    return count;
  }

  UniqueFd ours;
  UniqueFd theirs;
  std::array<char, 16> bytes{};
  ControlRoom<4> control{};
  std::array<UniqueFd, 4> descriptors;
  ReceivedDatagram received;
};

TEST_F(DatagramTest, BytesAndDescriptorsArriveTogetherAndCloseOnExec) {
  ASSERT_EQ(send("hello", {ours.get(), theirs.get()}), 0);
  ASSERT_EQ(receive(), 0);
  EXPECT_EQ(text(), "hello");
  ASSERT_EQ(received.descriptorCount, 2U);
  EXPECT_FALSE(received.areBytesCut || received.areDescriptorsCut || received.sender);
  for (std::size_t i = 0; i < 2; ++i) EXPECT_EQ(::fcntl(descriptors[i].get(), F_GETFD), FD_CLOEXEC);
}

TEST_F(DatagramTest, SeveralPiecesAreOneDatagram) {
  const std::string_view one = "ab";
  const std::string_view other = "cde";
  const std::array parts{iovecOf(std::as_bytes(std::span(one))), iovecOf({}),
                         iovecOf(std::as_bytes(std::span(other)))};
  ASSERT_EQ(sendDatagram(ours.get(), parts), 0);
  ASSERT_EQ(receive(), 0);
  EXPECT_EQ(text(), "abcde");
}

TEST_F(DatagramTest, WhatIsCutIsToldApart) {
  ASSERT_EQ(send("more than sixteen bytes"), 0);
  ASSERT_EQ(receive(), 0);
  EXPECT_EQ(received.length, bytes.size());
  EXPECT_TRUE(received.areBytesCut);
  EXPECT_FALSE(received.areDescriptorsCut);
}

// The room for control data is larger than that for descriptors, as credentials may come, too.
TEST_F(DatagramTest, DescriptorsWithoutAPlaceAreClosed) {
  const std::size_t before = openDescriptors();
  for (const std::size_t count : {std::size_t{5}, kMaxDatagramDescriptors}) {
    ASSERT_EQ(send("x", std::vector<int>(count, ours.get())), 0);
    ASSERT_EQ(receive(), 0);
    EXPECT_EQ(received.descriptorCount, 4U) << count;
    EXPECT_TRUE(received.areDescriptorsCut) << count;
    for (UniqueFd& each : descriptors) each.reset();
    EXPECT_EQ(openDescriptors(), before) << count;
  }
}

TEST_F(DatagramTest, NoMoreDescriptorsAreSentThanThereIsRoomFor) {
  EXPECT_EQ(send("x", std::vector<int>(kMaxDatagramDescriptors + 1, ours.get())), EINVAL);
  EXPECT_EQ(receive(), EAGAIN);
}

TEST_F(DatagramTest, CredentialsComeWhereTheyAreAskedFor) {
  ASSERT_TRUE(askForCredentials(theirs.get()));
  ASSERT_EQ(send("x", {ours.get()}), 0);
  ASSERT_EQ(receive(), 0);
  ASSERT_TRUE(received.sender);
  EXPECT_EQ(received.sender->pid, ::getpid());
  EXPECT_EQ(received.sender->uid, ::geteuid());
  EXPECT_EQ(received.descriptorCount, 1U);
}

// The kernel attaches it for a receiver whose socket asks; Linux before 6.5 does not know the wish.
TEST_F(DatagramTest, AProcessDescriptorThatNobodyAskedForIsClosed) {
  constexpr int kSoPasspidfd = 76;
  const int on = 1;
  if (::setsockopt(theirs.get(), SOL_SOCKET, kSoPasspidfd, &on, sizeof on) != 0)
    GTEST_SKIP() << "an older kernel";
  const std::size_t before = openDescriptors();
  ASSERT_EQ(send("x"), 0);
  ASSERT_EQ(receive(), 0);
  EXPECT_EQ(received.descriptorCount, 0U);
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(DatagramTest, ErrorsAreToldAndLeaveNothingOfTheMessageBefore) {
  EXPECT_EQ(receive(), EAGAIN);
  int error = 0;
  while (error == 0) error = send("x");
  EXPECT_EQ(error, EAGAIN) << "the channel is full";
  ASSERT_EQ(receive(), 0);
  ours.reset();
  while (receive() == 0 && received.length != 0) {
  }
  EXPECT_EQ(received.length, 0U) << "the end of the channel";
  theirs.reset();
  EXPECT_EQ(receive(), EBADF);
}

TEST_F(DatagramTest, APeerThatHasGoneIsAnErrorOfItsOwn) {
  theirs.reset();
  EXPECT_EQ(send("x"), EPIPE);
  EXPECT_EQ(send("x", {ours.get()}), EPIPE);
}

}  // namespace
}  // namespace brenvik
