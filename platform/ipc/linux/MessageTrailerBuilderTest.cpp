// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/MessageTrailerBuilder.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <cstdarg>
#include <string>
#include <string_view>

#include "platform/base/ProcessFacts.h"
#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingCalls.h"

namespace {

// What is opened in place of this process's /proc/PID/loginuid; -1: the file itself.
constinit int loginUidFile = -1;

}  // namespace

extern "C" int open(const char* path, int flags, ...) {
  mode_t mode = 0;
  if ((flags & O_CREAT) != 0) {
    va_list arguments;
    va_start(arguments, flags);
    mode = va_arg(arguments, mode_t);
    va_end(arguments);
  } else if (loginUidFile >= 0 && path == "/proc/" + std::to_string(::getpid()) + "/loginuid") {
    ::lseek(loginUidFile, 0, SEEK_SET);
    return ::fcntl(loginUidFile, F_DUPFD_CLOEXEC, 0);
  }
  return static_cast<int>(::syscall(SYS_openat, AT_FDCWD, path, flags, mode));
}
// What open() without a mode becomes where the C library's headers check calls (_FORTIFY_SOURCE).
extern "C" int checkedOpen(const char* path, int flags) __asm__("__open_2");
extern "C" int checkedOpen(const char* path, int flags) { return open(path, flags, 0); }

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

TEST(MessageTrailerBuilderTest, TheTokenBeginsWithTheAccountThatTheSenderLoggedInTo) {
  const UniqueFd file(::memfd_create("loginuid", MFD_CLOEXEC));
  loginUidFile = file.get();
  const auto loginUidWith = [&](std::string_view content) {
    EXPECT_EQ(::ftruncate(file.get(), 0), 0);
    EXPECT_EQ(::pwrite(file.get(), content.data(), content.size(), 0), static_cast<ssize_t>(content.size()));
    return buildTrailer(ucred{::getpid(), 501, 20}, 0).auditToken[0];
  };
  EXPECT_EQ(loginUidWith("1000\n"), 1000U);
  EXPECT_EQ(loginUidWith("7"), 7U);
  EXPECT_EQ(loginUidWith("4294967294"), 4294967294U);
  EXPECT_EQ(loginUidWith("4294967295"), 0xFFFFFFFFU);
  EXPECT_EQ(loginUidWith(""), 0xFFFFFFFFU);
  EXPECT_EQ(loginUidWith("nobody"), 0xFFFFFFFFU);
  loginUidFile = -1;
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
