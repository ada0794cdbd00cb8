// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/ipc/linux/StatusSocket.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "platform/base/fakes/LingeringSocket.h"
#include "platform/datagram/Datagram.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/runloop/fakes/ManualRunLoop.h"

namespace brenvik {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

class StatusSocketTest : public testing::Test {
 protected:
  StatusSocketTest() {
    std::string name = (fs::temp_directory_path() / "status-XXXXXX").string();
    folder = ::mkdtemp(name.data());
    service = folder / "service";
    path = folder / "service.status";
  }
  ~StatusSocketTest() override {
    socket.reset();
    fs::remove_all(folder);
  }
  void make() {
    socket = StatusSocket::make(
        ports, loop, service.string(), [this] { return answer; },
        [this] { return RefusalLimit::Time(clock.now()); });
  }
  UniqueFd connect() {
    UniqueFd end(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.string().copy(address.sun_path, sizeof address.sun_path - 1);
    if (::connect(end.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) end.reset();
    return end;
  }
  bool isWatched() const { return loop.interestIn(socket->descriptor()) == Interest::reading; }
  void serve() {
    if (isWatched()) (void)loop.makeReady(socket->descriptor(), {.isReadable = true});
  }
  // What has come: a text, "" for the end, "nothing" while there is neither.
  static std::string received(const UniqueFd& end) {
    std::array<char, 1024> text;
    const ssize_t size = ::recv(end.get(), text.data(), text.size(), MSG_DONTWAIT);
    return size < 0 ? "nothing" : std::string(text.data(), static_cast<std::size_t>(size));
  }
  static std::size_t descriptors() {
    const fs::directory_iterator all("/proc/self/fd");
    return static_cast<std::size_t>(std::distance(begin(all), end(all)));
  }

  ManualClock clock;
  ManualRunLoop loop{clock};
  SystemPortSpace ports;
  RecordingLog log;
  fs::path folder, service, path;
  std::string answer = "the status";
  std::unique_ptr<StatusSocket> socket;
};

TEST_F(StatusSocketTest, WhoConnectsIsToldOnceAndForgotten) {
  make();
  ASSERT_NE(socket, nullptr);
  const std::size_t before = descriptors();
  const UniqueFd end = connect();
  EXPECT_EQ(received(end), "nothing");
  serve();
  EXPECT_EQ(descriptors(), before + 1) << "the test's own end";
  EXPECT_EQ(received(end), "the status");
  EXPECT_EQ(received(end), "");
}

TEST_F(StatusSocketTest, TheFileIsForTheGroupAndGoesWithTheSocket) {
  make();
  struct stat facts {};
  ASSERT_EQ(::stat(path.c_str(), &facts), 0);
  EXPECT_EQ(facts.st_mode & 07777U, 0660U);
  socket.reset();
  EXPECT_FALSE(fs::exists(path));
}

TEST_F(StatusSocketTest, TheFileHasTheGroupOfTheServiceSocket) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root gives files away";
  std::ofstream(service).put('x');
  ASSERT_EQ(::chown(service.c_str(), 0, 604), 0);
  make();
  struct stat facts {};
  ASSERT_EQ(::stat(path.c_str(), &facts), 0);
  EXPECT_EQ(facts.st_uid, 0U);
  EXPECT_EQ(facts.st_gid, 604U);
}

TEST_F(StatusSocketTest, AStaleSocketIsReplaced) {
  const UniqueFd stale(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.string().copy(address.sun_path, sizeof address.sun_path - 1);
  ASSERT_EQ(::bind(stale.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  make();
  ASSERT_NE(socket, nullptr);
  EXPECT_TRUE(connect().isValid());
}

TEST_F(StatusSocketTest, AFileThatCameInItsPlaceStays) {
  make();
  fs::rename(path, folder / "ours");  // it keeps its number, so that the new one has another
  std::ofstream(path).put('x');
  socket.reset();
  EXPECT_TRUE(fs::exists(path));
}

TEST_F(StatusSocketTest, WhatIsNoSocketStaysAndALineSaysThatThereIsNoStatus) {
  std::ofstream(path).put('x');
  make();
  EXPECT_EQ(socket, nullptr);
  EXPECT_TRUE(fs::is_regular_file(path));
  EXPECT_EQ(log.entries(), std::vector{RecordingLog::unifiedLine(
                               LogLevel::info, "no status at " + path.string() + ": File exists")});
}

TEST_F(StatusSocketTest, AFolderThatIsNotThereIsTold) {
  service = folder / "none" / "service";
  make();
  EXPECT_EQ(socket, nullptr);
  EXPECT_EQ(log.entries(),
            std::vector{RecordingLog::unifiedLine(
                LogLevel::info, "no status at " + service.string() + ".status: No such file or directory")});
}

TEST_F(StatusSocketTest, APathThatIsTooLongIsTold) {
  service = folder / std::string(100, 'x');
  make();
  EXPECT_EQ(socket, nullptr);
  EXPECT_EQ(log.entries().size(), 1U);
}

TEST_F(StatusSocketTest, ALoopThatCannotWatchItLeavesNoFile) {
  loop.refuseDescriptors = true;
  make();
  EXPECT_EQ(socket, nullptr);
  EXPECT_FALSE(fs::exists(path));
}

TEST_F(StatusSocketTest, ACrowdIsTakenInSmallPartsWithPausesInBetween) {
  make();
  std::vector<UniqueFd> ends;
  for (int i = 0; i < 10; ++i) ends.push_back(connect());
  const auto told = [&ends] {
    int count = 0;
    for (const UniqueFd& each : ends) {
      std::array<char, 64> text;
      if (::recv(each.get(), text.data(), text.size(), MSG_DONTWAIT | MSG_PEEK) > 0) ++count;
    }
    return count;
  };
  serve();
  EXPECT_EQ(told(), 4);
  EXPECT_FALSE(isWatched());
  clock.advance(50ms);
  EXPECT_EQ(told(), 8);
  EXPECT_FALSE(isWatched());
  clock.advance(50ms);
  EXPECT_EQ(told(), 10);
  EXPECT_TRUE(isWatched());
}

TEST_F(StatusSocketTest, AnAccountThatAsksTooOftenIsSentAwayWithoutAWordUntilTimeHasPassed) {
  make();
  int told = 0;
  for (int i = 0; i < 60 && isWatched(); ++i) {
    const UniqueFd end = connect();
    serve();
    if (received(end) == answer) ++told;
  }
  EXPECT_EQ(told, RefusalLimit::kBurst);
  EXPECT_FALSE(isWatched()) << "and the loop is left in peace";
  clock.advance(50ms);
  ASSERT_TRUE(isWatched());
  const UniqueFd end = connect();
  serve();
  EXPECT_EQ(received(end), answer);
}

TEST_F(StatusSocketTest, WhatAPeerSentIsNotReadAndStaysNowhere) {
  make();
  const std::size_t before = descriptors();
  UniqueFd end = connect();
  const UniqueFd carried(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  const std::byte byte{'x'};
  const std::array parts{iovecOf(std::span(&byte, 1))};
  const std::array passed{carried.get()};
  ASSERT_EQ(sendDatagram(end.get(), parts, passed), 0);
  serve();
  ports.closing().drain();
  EXPECT_EQ(descriptors(), before + 2) << "the test's own two";
}

TEST_F(StatusSocketTest, WhileTheClosingLineHasNoRoomNobodyIsTaken) {
  make();
  std::array<LingeringSocket, 8> busy;  // 100 ms each
  for (LingeringSocket& each : busy) ports.closing().close(std::move(each.socket), ClosingLine::kClients);
  for (std::size_t i = 0; i < ClosingLine::kCapacity / 4; ++i)
    ports.closing().close(UniqueFd(::dup(STDERR_FILENO)), ClosingLine::kClients);
  const UniqueFd end = connect();
  serve();
  EXPECT_EQ(received(end), "nothing");
  EXPECT_FALSE(isWatched()) << "and the loop is left in peace";
  ports.closing().drain();
  clock.advance(50ms);
  EXPECT_EQ(received(end), answer);
}

TEST_F(StatusSocketTest, WithoutDescriptorsItWaitsAndDoesNotTurnInACircle) {
  make();
  const UniqueFd end = connect();
  {
    rlimit limit{};
    ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &limit), 0);
    const rlimit none{3, limit.rlim_max};
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
    serve();
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &limit), 0);
  }
  EXPECT_FALSE(isWatched());
  clock.advance(50ms);
  EXPECT_EQ(received(end), answer);
}

}  // namespace
}  // namespace brenvik
