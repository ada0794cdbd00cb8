// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstring>
#include <fstream>
#include <functional>
#include <memory>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "client/fakes/ScriptedHelper.h"
#include "client/include/brenvik/mobile_helper.h"
#include "platform/base/fakes/FailingCalls.h"

extern "C" int connect(int socket, const sockaddr* address, socklen_t size) {
  if (brenvik::FailingCall::failsNow("connect")) return -1;
  return static_cast<int>(::syscall(SYS_connect, socket, address, size));
}

// Connecting, waiting, and a helper that leaves, is late or lies.
namespace brenvik::client {
namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

struct FreeClient {
  void operator()(bvmh_client* client) const { bvmh_client_free(client); }
};
using ClientPointer = std::unique_ptr<bvmh_client, FreeClient>;

constexpr std::uint32_t kPlenty = 60'000;  // milliseconds; never used up when the code is right
constexpr std::uint32_t kShort = 40;       // milliseconds; always used up

ClientPointer clientFor(const std::string& path, std::uint32_t timeout = kPlenty) {
  ClientPointer client(bvmh_client_create());
  EXPECT_EQ(bvmh_client_set_socket(client.get(), path.c_str()), BVMH_OK);
  bvmh_client_set_timeout(client.get(), timeout);
  return client;
}

std::string asText(const bvmh_region& region) {
  return {static_cast<const char*>(region.bytes), region.size};
}

// ---- check-in ------------------------------------------------------------------------------------------

TEST(ClientTest, ChecksInWithADeathWatchPortMovedToTheHelper) {
  Message seen;
  ScriptedHelper helper([&](Script& script) {
    const UniqueFd connection = script.accept();
    seen = script.receive(connection);
    int ends[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends), 0);
    const UniqueFd ours(ends[0]);
    const UniqueFd theirs(ends[1]);
    script.send(connection, checkInReply(seen), {theirs.get()});
    script.expectEnd(connection);
    // The death-watch port stays open as long as the client, and no longer.
    ASSERT_EQ(seen.descriptors.size(), 1U);
    char byte = 0;
    EXPECT_EQ(::recv(seen.descriptors[0].get(), &byte, 1, MSG_DONTWAIT), -1);
    EXPECT_EQ(errno, EAGAIN);
    const Message request = script.receive(ours);
    script.send(ours, statusReply(request, 0));
    script.expectEnd(seen.descriptors[0]);
  });
  ClientPointer client = clientFor(helper.path());
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_OK);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_OK);
  client.reset();
  helper.finish();
  EXPECT_EQ(seen.bytes, Bytes(40)
                            .u32(0, 0x80000012)
                            .u32(4, 40)
                            .u32(8, seen.replyPort())
                            .i32(20, 4792174)
                            .u32(24, 1)
                            .u8(38, 17));
  EXPECT_NE(seen.replyPort(), 0U);
  int type = 0;
  socklen_t size = sizeof type;
  ASSERT_EQ(::getsockopt(seen.descriptors[0].get(), SOL_SOCKET, SO_TYPE, &type, &size), 0);
  EXPECT_EQ(type, SOCK_SEQPACKET);
}

TEST(ClientTest, ReportsARefusedCheckInAndStaysUnconnected) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd connection = script.accept();
    const Message request = script.receive(connection);
    script.send(connection, statusReply(request, 35));
  });
  const ClientPointer client = clientFor(helper.directory() + "/nothing");
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_ERROR_UNREACHABLE);
  EXPECT_EQ(bvmh_client_errno(client.get()), ENOENT);
  ASSERT_EQ(bvmh_client_set_socket(client.get(), helper.path().c_str()), BVMH_OK);
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_INVALID_SECURITY);
  EXPECT_EQ(bvmh_client_errno(client.get()), 0) << "it is the helper's refusal, and no error of the system";
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_ERROR_NOT_CONNECTED);
}

TEST(ClientTest, AnAccountThatMayNotConnectIsRefusedLikeOneThatLacksTheEntitlement) {
  ScriptedHelper helper([](Script&) {});
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(::chmod(helper.path().c_str(), 0), 0);
  const uid_t before = ::geteuid();
  ASSERT_EQ(::seteuid(before == 0 ? 65534 : before), 0);  // root passes over modes
  const std::int32_t code = bvmh_connect(client.get());
  ASSERT_EQ(::seteuid(before), 0);
  EXPECT_EQ(code, BVMH_INVALID_SECURITY);
  EXPECT_EQ(bvmh_client_errno(client.get()), EACCES);
}

TEST(ClientTest, TriesAgainWhenTheHelperStopsBeforeItAnswersTheCheckIn) {
  for (const bool readsFirst : {true, false}) {
    ScriptedHelper helper([&](Script& script) {
      for (int i = 0; i < 3; ++i) {
        const UniqueFd connection = script.accept();
        if (readsFirst) (void)script.receive(connection);
      }
      const UniqueFd channel = script.checkIn();
      const Message request = script.receive(channel);
      script.send(channel, statusReply(request, 0));
    });
    const ClientPointer client = clientFor(helper.path());
    EXPECT_EQ(bvmh_connect(client.get()), BVMH_OK);
    EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_OK);
  }
}

TEST(ClientTest, GivesUpWhenTheHelperAlwaysStopsBeforeItAnswers) {
  std::atomic<int> connections = 0;
  ScriptedHelper helper([&](Script& script) {
    for (int i = 0; i < 11; ++i) {
      const UniqueFd connection = script.accept();
      ++connections;
    }
  });
  const ClientPointer client = clientFor(helper.path());
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_ERROR_HELPER_GONE);
  EXPECT_EQ(connections, 11);
}

TEST(ClientTest, TriesAgainWhileTheSocketIsMissingBetweenTwoLivesOfTheHelper) {
  TemporaryDirectory directory;
  const std::string path = directory.path() + "/link";
  ScriptedHelper second([](Script& script) { (void)script.checkIn(); });
  std::unique_ptr<ScriptedHelper> first;
  first = std::make_unique<ScriptedHelper>([&](Script& script) {
    const UniqueFd connection = script.accept();
    ASSERT_EQ(::unlink(path.c_str()), 0);
    ASSERT_EQ(::symlink(second.path().c_str(), path.c_str()), 0);
  });
  ASSERT_EQ(::symlink(first->path().c_str(), path.c_str()), 0);
  const ClientPointer client = clientFor(path);
  const FailingCall missing("connect", ENOENT, 1);  // after the first helper and before the second
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_OK);
  EXPECT_EQ(missing.failures(), 1);
}

TEST(ClientTest, SaysAtOnceThatNobodyIsThere) {
  TemporaryDirectory directory;
  const ClientPointer client = clientFor(directory.path() + "/none");
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_ERROR_UNREACHABLE);
  EXPECT_EQ(bvmh_client_errno(client.get()), ENOENT);

  const std::string stale = directory.path() + "/stale";
  {
    const UniqueFd socket(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, stale.data(), stale.size());
    ASSERT_EQ(::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  }
  ASSERT_EQ(bvmh_client_set_socket(client.get(), stale.c_str()), BVMH_OK);
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_ERROR_UNREACHABLE);
  EXPECT_EQ(bvmh_client_errno(client.get()), ECONNREFUSED);
}

TEST(ClientTest, ACheckInThatIsNotAnsweredTimesOut) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd connection = script.accept();
    (void)script.receive(connection);
    script.expectEnd(connection);
  });
  const ClientPointer client = clientFor(helper.path(), kShort);
  const auto start = steady_clock::now();
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_ERROR_TIMED_OUT);
  EXPECT_GE(steady_clock::now() - start, milliseconds(kShort));
}

TEST(ClientTest, AFullBacklogTimesOut) {
  ScriptedHelper helper([](Script&) {});
  std::vector<UniqueFd> others;
  for (int i = 0; i < 9; ++i) others.push_back(connectTo(helper.path()));  // its backlog is 8
  const ClientPointer client = clientFor(helper.path(), kShort);
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_ERROR_TIMED_OUT);
}

// ---- a helper that leaves, or is late -------------------------------------------------------------------

TEST(ClientTest, ChecksInAgainWhenTheHelperHadLeftBetweenTwoRequests) {
  ScriptedHelper helper([](Script& script) {
    {
      const UniqueFd channel = script.checkIn();
      const Message request = script.receive(channel);
      script.send(channel, statusReply(request, 0));
    }
    const UniqueFd channel = script.checkIn();
    const Message request = script.receive(channel);
    EXPECT_EQ(request.id(), 8683552);
    script.send(channel, statusReply(request, 7));
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_OK);
  EXPECT_EQ(BVMobileHelperResetVoicemailStore(client.get()), 7);
}

TEST(ClientTest, SendsARequestAgainThatTheLeavingHelperHadNotRead) {
  std::atomic<int> requests = 0;
  ScriptedHelper helper([&](Script& script) {
    {
      const UniqueFd channel = script.checkIn();
      pollfd wait{channel.get(), POLLIN, 0};
      ASSERT_EQ(::poll(&wait, 1, 60'000), 1);  // it is there, and closed unread
    }
    const UniqueFd channel = script.checkIn();
    const Message request = script.receive(channel);
    ++requests;
    script.send(channel, statusReply(request, 0));
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_OK);
  helper.finish();
  EXPECT_EQ(requests, 1);
}

TEST(ClientTest, NeverSendsARequestAgainThatTheHelperHadRead) {
  ScriptedHelper helper([](Script& script) {
    {
      const UniqueFd channel = script.checkIn();
      (void)script.receive(channel);
    }
    // The next request is another one, on a new channel.
    const UniqueFd channel = script.checkIn();
    const Message request = script.receive(channel);
    EXPECT_EQ(request.id(), 8683552);
    script.send(channel, statusReply(request, 0));
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_ERROR_ANSWER_LOST);
  EXPECT_EQ(BVMobileHelperResetVoicemailStore(client.get()), BVMH_OK);
}

TEST(ClientTest, SaysThatTheHelperLeftWhenTheNewOneLeavesToo) {
  ScriptedHelper helper([](Script& script) {
    for (int i = 0; i < 2; ++i) (void)script.checkIn();
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_ERROR_HELPER_GONE);
}

TEST(ClientTest, ARequestThatIsNotAnsweredTimesOutAndItsLateAnswerIsSkipped) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message first = script.receive(channel);
    const Message second = script.receive(channel);
    const Message third = script.receive(channel);
    script.send(channel, statusReply(first, 1));
    script.send(channel, inLineReply(second, "late"));
    script.send(channel, statusReply(third, 33));
    script.expectEnd(channel);
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  bvmh_client_set_timeout(client.get(), kShort);
  const auto start = steady_clock::now();
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_ERROR_TIMED_OUT);
  EXPECT_GE(steady_clock::now() - start, milliseconds(kShort));
  bvmh_region region{};
  EXPECT_EQ(BVMobileHelperLoadPlistFile(client.get(), "/x", &region), BVMH_ERROR_TIMED_OUT);
  bvmh_client_set_timeout(client.get(), kPlenty);
  EXPECT_EQ(BVMobileHelperResetVoicemailStore(client.get()), 33);
}

TEST(ClientTest, TheTimeoutOfAnEarlierChannelIsSetOnANewOneToo) {
  ScriptedHelper helper([](Script& script) {
    (void)script.receive(script.checkIn());  // and leaves
    const UniqueFd channel = script.checkIn();
    script.send(channel, statusReply(script.receive(channel), 0));
    const Message unanswered = script.receive(channel);
    pollfd next{channel.get(), POLLIN, 0};
    const bool hasMore = ::poll(&next, 1, 10'000) == 1;  // who waits without a limit has not
    script.send(channel, statusReply(unanswered, 1));
    if (hasMore) script.send(channel, statusReply(script.receive(channel), 33));
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  bvmh_client_set_timeout(client.get(), kShort);
  EXPECT_NE(BVMobileHelperClearVoicemailToken(client.get()), BVMH_OK);
  bvmh_client_set_timeout(client.get(), kPlenty);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_OK);
  bvmh_client_set_timeout(client.get(), kShort);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_ERROR_TIMED_OUT);
  bvmh_client_set_timeout(client.get(), kPlenty);
  EXPECT_EQ(BVMobileHelperResetVoicemailStore(client.get()), 33);
}

TEST(ClientTest, TheChannelGetsTheTimeoutToTheMillisecond) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd connection = script.accept();
    const Message seen = script.receive(connection);
    int ends[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends), 0);
    const UniqueFd ours(ends[0]);
    const UniqueFd theirs(ends[1]);
    script.send(connection, checkInReply(seen), {theirs.get()});
    const Message request = script.receive(ours);
    timeval time{};
    socklen_t size = sizeof time;
    EXPECT_EQ(::getsockopt(theirs.get(), SOL_SOCKET, SO_RCVTIMEO, &time, &size), 0);
    EXPECT_EQ(time.tv_sec, 60);
    EXPECT_EQ(time.tv_usec, 500'000);
    script.send(ours, statusReply(request, 0));
  });
  const ClientPointer client = clientFor(helper.path(), 60'500);
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_OK);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_OK);
}

TEST(ClientTest, WhoWaitsForACheckInSleeps) {
  const long thread = ::syscall(SYS_gettid);
  bool isAsleep = false;
  ScriptedHelper helper([&](Script& script) {
    const UniqueFd connection = script.accept();
    const Message request = script.receive(connection);
    const auto end = steady_clock::now() + std::chrono::seconds(20);
    while (!isAsleep && steady_clock::now() < end) {
      std::ifstream file("/proc/self/task/" + std::to_string(thread) + "/stat");
      std::string line;
      std::getline(file, line);
      const auto name = line.rfind(") ");
      isAsleep = name != std::string::npos && line.substr(name + 2, 1) == "S";
      std::this_thread::yield();
    }
    script.send(connection, statusReply(request, 35));
  });
  const ClientPointer client = clientFor(helper.path());
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_INVALID_SECURITY);
  helper.finish();
  EXPECT_TRUE(isAsleep);
}

TEST(ClientTest, AnAnswerToARequestThatWasAnsweredAlreadyIsALie) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message first = script.receive(channel);
    script.send(channel, statusReply(first, 0));
    script.send(channel, statusReply(first, 0));
    (void)script.receive(channel);
    script.expectEnd(channel);
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_OK);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_ERROR_PROTOCOL);
}

TEST(ClientTest, AHelperThatReadsNothingCostsNoMoreThanTheTimeout) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    script.expectEnd(script.deathWatch());
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  bvmh_client_set_timeout(client.get(), 1);
  // More than any socket buffer takes, so that the last ones cannot even be sent.
  const std::string value(60'000, 'x');
  for (int i = 0; i < 50; ++i) {
    ASSERT_EQ(BVMobileHelperSetPreferenceValue(client.get(), "d", "k", value.data(), value.size()),
              BVMH_ERROR_TIMED_OUT);
  }
}

TEST(ClientTest, SignalsNeitherEndNorProlongAWait) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message request = script.receive(channel);
    script.expectEnd(channel);
  });
  struct sigaction quiet {};
  quiet.sa_handler = [](int) {};
  struct sigaction before {};
  ASSERT_EQ(::sigaction(SIGUSR1, &quiet, &before), 0);
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  bvmh_client_set_timeout(client.get(), 100);
  std::atomic<bool> isOver = false;
  std::thread signaller([&, target = ::pthread_self()] {
    while (!isOver) {
      ::pthread_kill(target, SIGUSR1);
      std::this_thread::yield();
    }
  });
  const auto start = steady_clock::now();
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_ERROR_TIMED_OUT);
  EXPECT_GE(steady_clock::now() - start, milliseconds(100));
  isOver = true;
  signaller.join();
  ::sigaction(SIGUSR1, &before, nullptr);
}

TEST(ClientTest, ReconnectLeavesTheOldChannelAndMakesANewOne) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd first = script.checkIn();
    const UniqueFd second = script.checkIn();
    script.expectEnd(first);
    script.expectEnd(second);
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  EXPECT_EQ(bvmh_connect(client.get()), BVMH_OK);  // nothing to do
  EXPECT_EQ(bvmh_reconnect(client.get()), BVMH_OK);
  bvmh_disconnect(client.get());
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_ERROR_NOT_CONNECTED);
}

// ---- arguments ------------------------------------------------------------------------------------------

TEST(ClientTest, ArgumentsThatDoNotFitAreRefusedBeforeAnythingIsSent) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message request = script.receive(channel);
    EXPECT_EQ(request.id(), 8683549);  // the one good call
    EXPECT_EQ(request.bytes, Bytes(288)
                                 .u32(0, 18)
                                 .u32(4, 288)
                                 .u32(8, request.replyPort())
                                 .i32(20, 8683549)
                                 .ndr(24)
                                 .text(32, std::string(255, 'x')));
    script.send(channel, statusReply(request, 0));
    script.expectEnd(channel);
  });
  const ClientPointer owner = clientFor(helper.path());
  bvmh_client* client = owner.get();
  ASSERT_EQ(bvmh_connect(client), BVMH_OK);
  const std::string fits(255, 'x');
  const std::string tooLong(256, 'x');
  char text[BVMH_TOKEN_SIZE];
  bool flag = false;
  bvmh_region region{};
  const auto refused = BVMH_ERROR_INVALID_ARGUMENT;
  EXPECT_EQ(BVMobileHelperSetVoicemailToken(client, nullptr), refused);
  EXPECT_EQ(BVMobileHelperSetVoicemailToken(nullptr, "x"), refused);
  EXPECT_EQ(BVMobileHelperSetVoicemailToken(client, tooLong.c_str()), refused);
  EXPECT_EQ(BVMobileHelperCopyVoicemailToken(client, nullptr, sizeof text), refused);
  EXPECT_EQ(BVMobileHelperCopyVoicemailToken(client, text, BVMH_TOKEN_SIZE - 1), refused);
  EXPECT_EQ(BVMobileHelperCopyCountryCode(client, text, BVMH_COUNTRY_CODE_SIZE - 1), refused);
  EXPECT_EQ(BVMobileHelperRemapContactsChannel(client, std::string(64, 'x').c_str(), "to", &flag), refused);
  EXPECT_EQ(BVMobileHelperRemapContactsChannel(client, "from", "to", nullptr), refused);
  EXPECT_EQ(BVMobileHelperCreateSymlink(client, std::string(1024, 'x').c_str(), "/l"), refused);
  EXPECT_EQ(BVMobileHelperLoadPlistFile(client, "/x", nullptr), refused);
  EXPECT_EQ(BVMobileHelperSetPreferenceValue(client, "d", "k", nullptr, 1), refused);
  EXPECT_EQ(BVMobileHelperSetPreferenceValue(client, "d", "k", "", std::size_t{1} << 32), refused);
  EXPECT_EQ(BVMobileHelperCopyBadgeLabels(client, nullptr, 1, "", 0, &region), refused);
  EXPECT_EQ(BVMobileHelperSetVoicemailToken(client, fits.c_str()), BVMH_OK);
  EXPECT_EQ(bvmh_client_set_socket(client, ""), refused);
  EXPECT_EQ(bvmh_client_set_socket(client, std::string(108, 'x').c_str()), refused);
}

TEST(ClientTest, OutValuesAreOnlyWrittenOnSuccess) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    for (int i = 0; i < 3; ++i) {
      const Message request = script.receive(channel);
      script.send(channel, statusReply(request, 5));
    }
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  char text[BVMH_TOKEN_SIZE] = "as it was";
  bool flag = true;
  bvmh_region region{text, 3, nullptr, nullptr};
  EXPECT_EQ(BVMobileHelperCopyVoicemailToken(client.get(), text, sizeof text), 5);
  EXPECT_STREQ(text, "as it was");
  EXPECT_EQ(BVMobileHelperCopyCrashLogs(client.get(), "/x", &flag), 5);
  EXPECT_TRUE(flag);
  EXPECT_EQ(BVMobileHelperLoadPlistFile(client.get(), "/x", &region), 5);
  EXPECT_EQ(region.bytes, nullptr);
  EXPECT_EQ(region.size, 0U);
}

TEST(ClientTest, TextsThatFillTheirFieldAreClosedByTheClient) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message country = script.receive(channel);
    script.send(channel, withResult(statusReply(country, 0), std::string(64, 'C')));
    const Message token = script.receive(channel);
    script.send(channel, withResult(statusReply(token, 0), std::string(256, 'T')));
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  char text[BVMH_TOKEN_SIZE];
  EXPECT_EQ(BVMobileHelperCopyCountryCode(client.get(), text, BVMH_COUNTRY_CODE_SIZE), BVMH_OK);
  EXPECT_EQ(text, std::string(64, 'C'));
  EXPECT_EQ(BVMobileHelperCopyVoicemailToken(client.get(), text, sizeof text), BVMH_OK);
  EXPECT_EQ(text, std::string(256, 'T'));
}

// ---- regions --------------------------------------------------------------------------------------------

std::string contentOf(const UniqueFd& memory, std::size_t size) {
  std::string content(size, '\0');
  EXPECT_EQ(::pread(memory.get(), content.data(), size, 0), static_cast<ssize_t>(size));
  return content;
}

TEST(ClientTest, AValueTravelsInTheDatagramWhileItFitsAndInSealedMemoryBeyond) {
  const std::size_t most = 65536 - 568;
  ScriptedHelper helper([&](Script& script) {
    const UniqueFd channel = script.checkIn();
    const Message fits = script.receive(channel);
    EXPECT_EQ(fits.bytes.size(), 65536U);
    EXPECT_EQ(fits.bytes.u32At(4), 568U);
    EXPECT_EQ(fits.bytes.u64At(28), 568U);
    EXPECT_EQ(fits.bytes.u32At(40), most);
    EXPECT_EQ(fits.bytes.u32At(564), most);
    EXPECT_TRUE(fits.descriptors.empty());
    script.send(channel, statusReply(fits, 0));

    const Message beyond = script.receive(channel);
    EXPECT_EQ(beyond.bytes.size(), 568U);
    EXPECT_EQ(beyond.bytes.u64At(28), 0U);
    EXPECT_EQ(beyond.bytes.u32At(40), most + 1);
    EXPECT_EQ(beyond.bytes.u32At(564), most + 1);
    ASSERT_EQ(beyond.descriptors.size(), 1U);
    const UniqueFd& memory = beyond.descriptors[0];
    EXPECT_EQ(::fcntl(memory.get(), F_GET_SEALS) & kAllSeals, kAllSeals);
    struct stat facts {};
    EXPECT_EQ(::fstat(memory.get(), &facts), 0);
    EXPECT_EQ(facts.st_size, static_cast<off_t>(most + 1));
    EXPECT_EQ(contentOf(memory, most + 1), std::string(most + 1, 'v'));
    script.send(channel, statusReply(beyond, 0));

    const Message nothing = script.receive(channel);
    EXPECT_EQ(nothing.bytes.size(), 568U);
    EXPECT_EQ(nothing.bytes.u64At(28), 0U);
    EXPECT_EQ(nothing.bytes.u32At(40), 0U);
    EXPECT_TRUE(nothing.descriptors.empty());
    script.send(channel, statusReply(nothing, 5));
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  const std::string value(most + 1, 'v');
  EXPECT_EQ(BVMobileHelperSetPreferenceValue(client.get(), "d", "k", value.data(), most), BVMH_OK);
  EXPECT_EQ(BVMobileHelperSetPreferenceValue(client.get(), "d", "k", value.data(), most + 1), BVMH_OK);
  EXPECT_EQ(BVMobileHelperSetPreferenceValue(client.get(), "d", "k", nullptr, 0), BVMH_FAILURE);
}

TEST(ClientTest, OfTwoRegionsEachTravelsAsItFits) {
  const std::string large(70'000, 'L');
  const std::string half(40'000, 'H');
  ScriptedHelper helper([&](Script& script) {
    const UniqueFd channel = script.checkIn();
    const auto answer = [&](const Message& request) { script.send(channel, inLineReply(request, "x")); };
    // The first in memory, the second is then the first in the datagram.
    const Message first = script.receive(channel);
    EXPECT_EQ(first.bytes.size(), 80U + 2U);
    EXPECT_EQ(first.bytes.u64At(28), 0U);
    EXPECT_EQ(first.bytes.u64At(44), 80U);
    ASSERT_EQ(first.descriptors.size(), 1U);
    EXPECT_EQ(contentOf(first.descriptors[0], large.size()), large);
    answer(first);
    // Only the first fits.
    const Message second = script.receive(channel);
    EXPECT_EQ(second.bytes.size(), 80U + half.size());
    EXPECT_EQ(second.bytes.u64At(28), 80U);
    EXPECT_EQ(second.bytes.u64At(44), 0U);
    EXPECT_EQ(second.bytes.u32At(56), half.size());
    ASSERT_EQ(second.descriptors.size(), 1U);
    answer(second);
    // Neither, in the order of the descriptors.
    const Message third = script.receive(channel);
    EXPECT_EQ(third.bytes.size(), 76U);
    ASSERT_EQ(third.descriptors.size(), 2U);
    EXPECT_EQ(contentOf(third.descriptors[0], 1), "L");
    EXPECT_EQ(contentOf(third.descriptors[1], 1), "M");
    answer(third);
    // An empty one carries nothing and takes no place.
    const Message fourth = script.receive(channel);
    EXPECT_EQ(fourth.bytes.size(), 80U + 2U);
    EXPECT_EQ(fourth.bytes.u32At(40), 0U);
    EXPECT_EQ(fourth.bytes.u64At(44), 80U);
    answer(fourth);
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  const std::string other(70'000, 'M');
  const auto call = [&](std::string_view labels, std::string_view languages) {
    bvmh_region region{};
    EXPECT_EQ(BVMobileHelperCopyBadgeLabels(client.get(), labels.data(), labels.size(), languages.data(),
                                            languages.size(), &region),
              BVMH_OK);
    bvmh_region_free(&region);
  };
  call(large, "[]");
  call(half, half);
  call(large, other);
  call("", "[]");
}

TEST(ClientTest, ReturnedRegionsOutliveTheClient) {
  const std::string small(100, 's');
  const std::string large(65536 - 56, 'l');
  const std::string larger(300'000, 'm');
  std::vector<bvmh_region> regions;
  {
    ScriptedHelper helper([&](Script& script) {
      const UniqueFd channel = script.checkIn();
      script.send(channel, inLineReply(script.receive(channel), small));
      script.send(channel, inLineReply(script.receive(channel), large));
      const Message third = script.receive(channel);
      const UniqueFd memory = makeMemory(larger, kAllSeals);
      script.send(channel, outOfLineReply(third, static_cast<std::uint32_t>(larger.size()), 0),
                  {memory.get()});
      const Message fourth = script.receive(channel);
      script.send(channel, inLineReply(fourth, ""));
      // Longer than it says is fine; what is beyond is not shown.
      const Message fifth = script.receive(channel);
      script.send(channel, outOfLineReply(fifth, 10, 0), {memory.get()});
    });
    const ClientPointer client = clientFor(helper.path());
    ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
    for (int i = 0; i < 5; ++i) {
      ASSERT_EQ(BVMobileHelperLoadPlistFile(client.get(), "/x", &regions.emplace_back()), BVMH_OK);
    }
  }
  EXPECT_EQ(asText(regions[0]), small);
  EXPECT_EQ(asText(regions[1]), large);
  EXPECT_EQ(asText(regions[2]), larger);
  EXPECT_EQ(regions[3].bytes, nullptr);
  EXPECT_EQ(asText(regions[4]), larger.substr(0, 10));
  for (bvmh_region& each : regions) {
    bvmh_region_free(&each);
    bvmh_region_free(&each);  // empty by now
  }
  bvmh_region_free(nullptr);
}

// ---- a helper that lies ---------------------------------------------------------------------------------

struct Lie {
  const char* name;
  std::function<void(Script&, const UniqueFd&, const Message&)> tell;
};

void expectCaught(const std::vector<Lie>& lies, const std::function<std::int32_t(bvmh_client*)>& call) {
  for (const Lie& lie : lies) {
    SCOPED_TRACE(lie.name);
    const std::size_t before = openDescriptors();
    {
      ScriptedHelper helper([&](Script& script) {
        {
          const UniqueFd channel = script.checkIn();
          lie.tell(script, channel, script.receive(channel));
          script.expectEnd(channel);
        }
        // The channel is not used any more, but the client is not lost.
        const UniqueFd channel = script.checkIn();
        script.send(channel, statusReply(script.receive(channel), 5));
      });
      const ClientPointer client = clientFor(helper.path());
      ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
      EXPECT_EQ(call(client.get()), BVMH_ERROR_PROTOCOL);
      EXPECT_EQ(call(client.get()), BVMH_FAILURE);
    }
    EXPECT_EQ(openDescriptors(), before);
  }
}

std::int32_t loadPlist(bvmh_client* client) {
  bvmh_region region{};
  const std::int32_t code = BVMobileHelperLoadPlistFile(client, "/x", &region);
  EXPECT_EQ(region.bytes, nullptr);
  return code;
}

TEST(ClientTest, WrongStatusRepliesAreCaught) {
  const auto bytes = [](auto change) {
    return [=](Script& script, const UniqueFd& channel, const Message& request) {
      Bytes reply = statusReply(request, 0);
      change(reply);
      script.send(channel, reply);
    };
  };
  const auto cut = [](std::size_t size) {
    return [=](Script& script, const UniqueFd& channel, const Message& request) {
      script.send(channel, Bytes(statusReply(request, 0).string().substr(0, size)));
    };
  };
  expectCaught(
      {
          {"one byte", cut(1)},
          {"a byte less than a header", cut(23)},
          {"a header only", cut(24)},
          {"a byte short", cut(35)},
          {"a byte long", bytes([](Bytes& b) { b.append("x"); })},
          {"larger than any datagram", bytes([](Bytes& b) { b.append(std::string(65'536, 'x')); })},
          {"with results that the routine has not", bytes([](Bytes& b) { b.append("\1\0\0\0"); })},
          {"the request's own id", bytes([](Bytes& b) { b.i32(20, b.i32At(20) - 100); })},
          {"another routine's id", bytes([](Bytes& b) { b.i32(20, b.i32At(20) + 1); })},
          {"a reply port of its own", bytes([](Bytes& b) { b.u32(8, 5); })},
          {"another request's port", bytes([](Bytes& b) { b.u32(12, b.u32At(12) + 1); })},
          {"an earlier request's port", bytes([](Bytes& b) { b.u32(12, b.u32At(12) - 1); })},
          {"port 0", bytes([](Bytes& b) { b.u32(12, 0); })},
          {"complex", bytes([](Bytes& b) { b.u32(0, 0x80000012); })},
          {"the transport's own code", bytes([](Bytes& b) { b.i32(32, BVMH_ERROR_TIMED_OUT); })},
          {"with a descriptor",
           [](Script& script, const UniqueFd& channel, const Message& request) {
             script.send(channel, statusReply(request, 0), {STDIN_FILENO});
           }},
          {"with nine descriptors",
           [](Script& script, const UniqueFd& channel, const Message& request) {
             script.send(channel, statusReply(request, 0), std::vector<int>(9, STDIN_FILENO));
           }},
      },
      BVMobileHelperClearVoicemailToken);
}

TEST(ClientTest, WrongResultsAreCaught) {
  const auto results = [](std::int32_t code, std::size_t size) {
    return [=](Script& script, const UniqueFd& channel, const Message& request) {
      script.send(channel, withResult(statusReply(request, code), std::string(size, '\1')));
    };
  };
  expectCaught({{"success without the result", results(0, 0)},
                {"a byte short", results(0, 3)},
                {"a byte long", results(0, 5)},
                {"another form", results(0, 64)},
                {"a failure with a result", results(5, 4)}},
               [](bvmh_client* client) {
                 bool flag = false;
                 return BVMobileHelperCopyCrashLogs(client, "/x", &flag);
               });
}

TEST(ClientTest, WrongRegionsAreCaught) {
  const auto inLine = [](auto change) {
    return [=](Script& script, const UniqueFd& channel, const Message& request) {
      Bytes reply = inLineReply(request, "sixteen bytes ..");
      change(reply);
      script.send(channel, reply);
    };
  };
  const auto inMemory = [](std::uint32_t size, int seals, auto change) {
    return [=](Script& script, const UniqueFd& channel, const Message& request) {
      const UniqueFd memory = makeMemory("sixteen bytes ..", seals);
      Bytes reply = outOfLineReply(request, size, 0);
      std::vector<int> descriptors{memory.get()};
      change(reply, descriptors);
      script.send(channel, reply, descriptors);
    };
  };
  const auto asIs = [](Bytes&, std::vector<int>&) {};
  std::vector<Lie> lies{
      {"success without a region",
       [](Script& script, const UniqueFd& channel, const Message& request) {
         script.send(channel, statusReply(request, 0));
       }},
      {"simple", inLine([](Bytes& b) { b.u32(0, 18); })},
      {"no descriptor in the body", inLine([](Bytes& b) { b.u32(24, 0); })},
      {"two descriptors in the body", inLine([](Bytes& b) { b.u32(24, 2); })},
      {"a port descriptor", inLine([](Bytes& b) { b.u8(39, 0); })},
      {"an unknown descriptor type", inLine([](Bytes& b) { b.u8(39, 2); })},
      {"two lengths", inLine([](Bytes& b) { b.u32(52, 15); })},
      {"a region before the message's end", inLine([](Bytes& b) { b.u64(28, 48); })},
      {"a region in the header", inLine([](Bytes& b) { b.u64(28, 8); })},
      {"an unaligned region", inLine([](Bytes& b) { b.u64(28, 57); })},
      {"a region outside", inLine([](Bytes& b) { b.u64(28, 72); })},
      {"a region far outside", inLine([](Bytes& b) { b.u64(28, 0xFFFFFFFFFFFFFFF8); })},
      {"a region longer than the datagram", inLine([](Bytes& b) { b.u32(40, 17).u32(52, 17); })},
      {"a region of 4 GiB", inLine([](Bytes& b) { b.u32(40, 0xFFFFFFFF).u32(52, 0xFFFFFFFF); })},
      {"bytes after the region", inLine([](Bytes& b) { b.append("x"); })},
      {"bytes after no region", inLine([](Bytes& b) { b.u64(28, 0).u32(40, 0).u32(52, 0); })},
      {"a size that is not the message's", inLine([](Bytes& b) { b.u32(4, 64); })},
      {"an in-line region and a descriptor",
       [](Script& script, const UniqueFd& channel, const Message& request) {
         script.send(channel, inLineReply(request, "x"), {STDIN_FILENO});
       }},
      {"no memory", inMemory(16, kAllSeals, [](Bytes&, std::vector<int>& d) { d.clear(); })},
      {"memory for nothing", inMemory(0, kAllSeals, asIs)},
      {"memory twice", inMemory(16, kAllSeals, [](Bytes&, std::vector<int>& d) { d.push_back(d[0]); })},
      {"memory shorter than it says", inMemory(17, kAllSeals, asIs)},
      {"memory and bytes after the message", inMemory(16, kAllSeals, [](Bytes& b, auto&) { b.append("x"); })},
  };
  for (int seals = 0; seals < 16; seals += 2) {
    if (seals != kAllSeals) lies.push_back({"memory with seals missing", inMemory(16, seals, asIs)});
  }
  expectCaught(lies, loadPlist);
}

TEST(ClientTest, AReadableFileIsNoSealedMemory) {
  expectCaught({{"a plain file",
                 [](Script& script, const UniqueFd& channel, const Message& request) {
                   const UniqueFd file(::open("/proc/self/exe", O_RDONLY | O_CLOEXEC));
                   script.send(channel, outOfLineReply(request, 16, 0), {file.get()});
                 }},
                {"a socket",
                 [](Script& script, const UniqueFd& channel, const Message& request) {
                   script.send(channel, outOfLineReply(request, 16, 0), {channel.get()});
                 }}},
               loadPlist);
}

// Its mappings have another unit, so the region could not be unmapped by its size.
TEST(ClientTest, MemoryOfHugePagesIsNoRegion) {
  const UniqueFd huge(::memfd_create("test", MFD_CLOEXEC | MFD_ALLOW_SEALING | MFD_HUGETLB));
  if (!huge.isValid()) GTEST_SKIP() << "no huge pages here";
  ASSERT_EQ(::ftruncate(huge.get(), 2 << 20), 0);
  ASSERT_EQ(::fcntl(huge.get(), F_ADD_SEALS, F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE), 0);
  expectCaught({{"memory of huge pages",
                 [&](Script& script, const UniqueFd& channel, const Message& request) {
                   script.send(channel, outOfLineReply(request, 16, 0), {huge.get()});
                 }}},
               loadPlist);
}

TEST(ClientTest, WrongCheckInRepliesAreCaught) {
  struct CheckInLie {
    const char* name;
    std::function<Bytes(const Message&)> reply;
    int domain;
    int type;
    int count;
  };
  const auto good = [](const Message& request) { return checkInReply(request); };
  const std::vector<CheckInLie> lies{
      {"bare success", [](const Message& request) { return statusReply(request, 0); }, AF_UNIX,
       SOCK_SEQPACKET, 0},
      {"no right", good, AF_UNIX, SOCK_SEQPACKET, 0},
      {"two rights", good, AF_UNIX, SOCK_SEQPACKET, 2},
      {"a stream", good, AF_UNIX, SOCK_STREAM, 1},
      {"a datagram socket", good, AF_UNIX, SOCK_DGRAM, 1},
      {"an internet socket", good, AF_INET, SOCK_STREAM, 1},
      {"a byte long", [](const Message& r) { return checkInReply(r).append("x"); }, AF_UNIX, SOCK_SEQPACKET,
       1},
      {"a byte short", [](const Message& r) { return Bytes(checkInReply(r).string().substr(0, 39)); },
       AF_UNIX, SOCK_SEQPACKET, 1},
      {"an out-of-line descriptor", [](const Message& r) { return checkInReply(r).u8(39, 1); }, AF_UNIX,
       SOCK_SEQPACKET, 1},
      {"a moved right", [](const Message& r) { return checkInReply(r).u8(38, 17); }, AF_UNIX, SOCK_SEQPACKET,
       1},
      {"two descriptors in the body", [](const Message& r) { return checkInReply(r).u32(24, 2); }, AF_UNIX,
       SOCK_SEQPACKET, 1},
  };
  for (const CheckInLie& lie : lies) {
    SCOPED_TRACE(lie.name);
    const std::size_t before = openDescriptors();
    {
      ScriptedHelper helper([&](Script& script) {
        const UniqueFd connection = script.accept();
        const Message request = script.receive(connection);
        const UniqueFd socket(::socket(lie.domain, lie.type | SOCK_CLOEXEC, 0));
        script.send(connection, lie.reply(request),
                    std::vector<int>(static_cast<std::size_t>(lie.count), socket.get()));
        script.expectEnd(connection);
      });
      const ClientPointer client = clientFor(helper.path());
      EXPECT_EQ(bvmh_connect(client.get()), BVMH_ERROR_PROTOCOL);
    }
    EXPECT_EQ(openDescriptors(), before);
  }
}

TEST(ClientTest, AChannelThatDoesNotBlockIsWaitedForAllTheSame) {
  ScriptedHelper helper([](Script& script) {
    const UniqueFd connection = script.accept();
    const Message request = script.receive(connection);
    int ends[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends), 0);
    const UniqueFd ours(ends[0]);
    const UniqueFd theirs(ends[1]);
    script.send(connection, checkInReply(request), {theirs.get()});
    const Message first = script.receive(ours);
    // Made not to block again behind the client's back.
    ASSERT_EQ(::fcntl(theirs.get(), F_SETFL, O_NONBLOCK), 0);
    script.send(ours, statusReply(first, 0));
    const Message second = script.receive(ours);
    script.send(ours, statusReply(second, 0));
    const Message third = script.receive(ours);
    script.expectEnd(request.descriptors[0]);
  });
  const ClientPointer client = clientFor(helper.path());
  ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_OK);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_OK);
  bvmh_client_set_timeout(client.get(), kShort);
  EXPECT_EQ(BVMobileHelperClearVoicemailToken(client.get()), BVMH_ERROR_TIMED_OUT);
}

// ---- descriptors ----------------------------------------------------------------------------------------

std::size_t inheritableDescriptors() {
  std::size_t count = 0;
  for (int descriptor = 0; descriptor < 256; ++descriptor) {
    const int flags = ::fcntl(descriptor, F_GETFD);
    if (flags >= 0 && (flags & FD_CLOEXEC) == 0) ++count;
  }
  return count;
}

TEST(ClientTest, NothingStaysOpenAndEverythingIsCloseOnExec) {
  const std::size_t before = openDescriptors();
  const std::size_t inheritable = inheritableDescriptors();
  for (int i = 0; i < 20; ++i) {
    ScriptedHelper helper([&](Script& script) {
      const UniqueFd channel = script.checkIn();
      const Message request = script.receive(channel);
      const UniqueFd memory = makeMemory(std::string(100, 'x'), kAllSeals);
      script.send(channel, outOfLineReply(request, 100, 0), {memory.get()});
      script.expectEnd(channel);
    });
    const ClientPointer client = clientFor(helper.path());
    ASSERT_EQ(bvmh_connect(client.get()), BVMH_OK);
    bvmh_region region{};
    ASSERT_EQ(BVMobileHelperLoadPlistFile(client.get(), "/x", &region), BVMH_OK);
    EXPECT_EQ(inheritableDescriptors(), inheritable);
    bvmh_region_free(&region);
  }
  EXPECT_EQ(openDescriptors(), before);
}

TEST(ClientTest, EveryCodeHasATextOfItsOwn) {
  std::set<std::string> texts;
  for (std::int32_t code = BVMH_ERROR_FIRST; code <= BVMH_ERROR_LAST; ++code) {
    EXPECT_STRNE(bvmh_error_text(code), "");
  }
  const std::array named{BVMH_OK,
                         BVMH_NO_SPACE,
                         BVMH_FAILURE,
                         BVMH_RESOURCE_SHORTAGE,
                         BVMH_NO_ACCESS,
                         BVMH_MEMORY_FAILURE,
                         BVMH_INVALID_SECURITY,
                         BVMH_NOT_SUPPORTED,
                         BVMH_TYPE_ERROR,
                         BVMH_BAD_ID,
                         BVMH_BAD_ARGUMENTS,
                         BVMH_TRAILER_ERROR,
                         BVMH_ERROR_INVALID_ARGUMENT,
                         BVMH_ERROR_NO_MEMORY,
                         BVMH_ERROR_NOT_CONNECTED,
                         BVMH_ERROR_UNREACHABLE,
                         BVMH_ERROR_TIMED_OUT,
                         BVMH_ERROR_HELPER_GONE,
                         BVMH_ERROR_ANSWER_LOST,
                         BVMH_ERROR_PROTOCOL,
                         BVMH_ERROR_SYSTEM,
                         BVMH_ERROR_NAME_IN_USE,
                         BVMH_ERROR_NO_LONGER_THERE};
  for (const std::int32_t code : named) {
    const std::string text = bvmh_error_text(code);
    EXPECT_TRUE(texts.insert(text).second) << text;
    EXPECT_FALSE(text.starts_with("unknown") || text.ends_with("a code of its system")) << code;
  }
  EXPECT_STREQ(bvmh_error_text(BVMH_OK), "success");
  EXPECT_STREQ(bvmh_error_text(BVMH_INVALID_SECURITY),
               "the caller lacks the entitlement com.norvale.Teravox.BrenvikHelper.allow");
  EXPECT_STREQ(bvmh_error_text(4711), "the helper answered with a code of its system");
  EXPECT_STREQ(bvmh_error_text(BVMH_ERROR_FIRST), "unknown transport failure");
}

}  // namespace
}  // namespace brenvik::client
