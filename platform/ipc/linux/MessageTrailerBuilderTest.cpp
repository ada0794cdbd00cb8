// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/MessageTrailerBuilder.h"

#include <gtest/gtest.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>

#include "platform/base/ProcessFacts.h"
#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingCalls.h"

extern "C" int getsockopt(int fd, int level, int name, void* value, socklen_t* size) noexcept {
  if (brenvik::FailingCall::failsNow("getsockopt")) return -1;
  return static_cast<int>(::syscall(SYS_getsockopt, fd, level, name, value, size));
}

namespace brenvik {
namespace {

TEST(MessageTrailerBuilderTest, TheTokenNamesTheSendersAccountProcessAndStart) {
  const MessageTrailer trailer = buildTrailer(ucred{::getpid(), 501, 20}, 3);
  EXPECT_EQ(trailer.type, 0U);
  EXPECT_EQ(trailer.size, 52U);
  EXPECT_EQ(trailer.sequence, 3U);
  EXPECT_EQ(trailer.senderUid, 501U);
  EXPECT_EQ(trailer.senderGid, 20U);
  const std::array<std::uint32_t, 6> accounts{
      501, 20, 501, 20, static_cast<std::uint32_t>(::getpid()), static_cast<std::uint32_t>(::getsid(0))};
  for (std::size_t i = 0; i < accounts.size(); ++i) EXPECT_EQ(trailer.auditToken[1 + i], accounts[i]) << i;
  EXPECT_EQ(trailer.auditToken[7], processStartTime(::getpid()));
}

TEST(MessageTrailerBuilderTest, ASenderThatIsGoneOrOfAnotherNamespaceHasNoLoginNoSessionAndPidVersion0) {
  for (const pid_t pid : {0x7FFFFFFF, 0, -1}) {
    const MessageTrailer trailer = buildTrailer(ucred{pid, 501, 20}, 0);
    EXPECT_EQ(trailer.auditToken[0], 0xFFFFFFFFU) << pid;
    EXPECT_EQ(trailer.auditToken[1], 501U) << pid;
    EXPECT_EQ(trailer.auditToken[5], static_cast<std::uint32_t>(pid));
    EXPECT_EQ(trailer.auditToken[6], 0U) << pid;
    EXPECT_EQ(trailer.auditToken[7], 0U) << pid;
  }
}

class PinPeerTest : public testing::Test {
 protected:
  void SetUp() override {
    std::array<int, 2> ends{};
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends.data()), 0);
    connection.reset(ends[0]);
    peer.reset(ends[1]);
  }
  UniqueFd connection;
  UniqueFd peer;
};

TEST_F(PinPeerTest, TheSenderMustBeThePeerAndThePeerMustBeKnown) {
  if (pinPeer(connection.get(), ::getpid(), ::getpid()) == PeerPin::unsupported) {
    GTEST_SKIP() << "the kernel cannot tell";
  }
  EXPECT_EQ(pinPeer(connection.get(), ::getpid(), ::getpid()), PeerPin::confirmed);
  EXPECT_EQ(pinPeer(connection.get(), ::getpid(), ::getppid()), PeerPin::refused);
  EXPECT_EQ(pinPeer(connection.get(), 0, 0), PeerPin::refused) << "a peer of another namespace";
}

TEST_F(PinPeerTest, OnlyAKernelWithoutTheOptionLeavesItOpen) {
  {
    const FailingCall older("getsockopt", ENOPROTOOPT);
    EXPECT_EQ(pinPeer(connection.get(), ::getpid(), ::getpid()), PeerPin::unsupported);
  }
  for (const int error : {ESRCH, ENODATA, EMFILE, ENOMEM}) {
    const FailingCall failing("getsockopt", error);
    EXPECT_EQ(pinPeer(connection.get(), ::getpid(), ::getpid()), PeerPin::refused) << error;
  }
}

}  // namespace
}  // namespace brenvik
