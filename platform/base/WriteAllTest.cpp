// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/WriteAll.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <string>
#include <thread>

#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingCalls.h"

// 0 as the error: it writes nothing and names no error.
extern "C" ssize_t pwrite(int file, const void* bytes, std::size_t size, off_t offset) {
  if (brenvik::FailingCall::failsNow("pwrite")) return errno == 0 ? 0 : -1;
  return ::syscall(SYS_pwrite64, file, bytes, size, offset);
}

namespace brenvik {
namespace {

iovec pieceOf(std::string& text) { return {text.data(), text.size()}; }

std::string contentOf(int file) {
  std::string text(100, '\0');
  text.resize(static_cast<std::size_t>(::pread(file, text.data(), text.size(), 0)));
  return text;
}

struct Pipe {
  Pipe() {
    std::array<int, 2> ends{};
    EXPECT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
    from.reset(ends[0]);
    to.reset(ends[1]);
  }
  UniqueFd from, to;
};

TEST(WriteAllTest, WritesAtTheFilesPositionAndAtAnOffset) {
  const UniqueFd file(::memfd_create("test", MFD_CLOEXEC));
  EXPECT_EQ(writeAll(file.get(), std::string_view("one two")), 0);
  EXPECT_EQ(writeAllAt(file.get(), 4, "TWO"), 0);
  EXPECT_EQ(writeAll(file.get(), std::string_view(" three")), 0);
  EXPECT_EQ(contentOf(file.get()), "one TWO three");
}

TEST(WriteAllTest, WritesPiecesInTheirOrderEmptyOnesIncluded) {
  const UniqueFd file(::memfd_create("test", MFD_CLOEXEC));
  std::string none, a = "one", b = " two";
  std::array pieces{pieceOf(none), pieceOf(a), pieceOf(none), pieceOf(b), pieceOf(none)};
  EXPECT_EQ(writeAll(file.get(), pieces), 0);
  EXPECT_EQ(contentOf(file.get()), "one two");
  std::array empty{pieceOf(none), pieceOf(none)};
  EXPECT_EQ(writeAll(file.get(), empty), 0);
  EXPECT_EQ(writeAll(file.get(), std::string_view()), 0);
}

// Signals interrupt a write that waits for room: it has written a part then.
TEST(WriteAllTest, GoesOnAfterAShortWrite) {
  Pipe pipe;
  struct sigaction ignore {};
  ignore.sa_handler = [](int) {};  // without SA_RESTART
  struct sigaction before {};
  ASSERT_EQ(::sigaction(SIGUSR1, &ignore, &before), 0);
  ASSERT_GT(::fcntl(pipe.to.get(), F_SETPIPE_SZ, 4096), 0);
  std::string first, second, got;
  for (int i = 0; i < 6000; ++i) first += std::to_string(i) + ' ';
  for (int i = 6000; i < 12'000; ++i) second += std::to_string(i) + ' ';
  std::thread reader([&, writer = ::pthread_self()] {
    std::array<char, 1000> some;
    for (ssize_t size = 0; (size = ::read(pipe.from.get(), some.data(), some.size())) > 0;) {
      got.append(some.data(), static_cast<std::size_t>(size));
      ::pthread_kill(writer, SIGUSR1);
    }
  });
  std::array pieces{pieceOf(first), pieceOf(second)};
  EXPECT_EQ(writeAll(pipe.to.get(), pieces), 0);
  EXPECT_EQ(writeAll(pipe.to.get(), first), 0);
  pipe.to.reset();
  reader.join();
  ::sigaction(SIGUSR1, &before, nullptr);
  EXPECT_EQ(got, first + second + first);
}

TEST(WriteAllTest, ReturnsTheErrorOfTheCallThatFailed) {
  EXPECT_EQ(writeAll(-1, std::string_view("x")), EBADF);
  EXPECT_EQ(writeAllAt(-1, 0, "x"), EBADF);
  const Pipe pipe;
  ASSERT_EQ(::fcntl(pipe.to.get(), F_SETFL, O_NONBLOCK), 0);
  const std::string large(1'000'000, 'x');
  EXPECT_EQ(writeAll(pipe.to.get(), large), EAGAIN) << "after some of it was written";
}

TEST(WriteAllTest, ACallThatWritesNothingFailsAndAnInterruptedOneIsRepeated) {
  const UniqueFd file(::memfd_create("test", MFD_CLOEXEC));
  const FailingCall nothing("pwrite", 0);
  EXPECT_EQ(writeAllAt(file.get(), 0, "x"), EIO);
  const FailingCall interrupted("pwrite", EINTR);
  EXPECT_EQ(writeAllAt(file.get(), 0, "y"), 0);
  EXPECT_EQ(contentOf(file.get()), "y");
}

}  // namespace
}  // namespace brenvik
