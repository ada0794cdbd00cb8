// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "client/TurnedAway.h"
#include "client/fakes/ScriptedHelper.h"
#include "client/include/brenvik/mobile_helper.h"

// The telephony daemon's side, with a helper played by the test.
namespace brenvik::client {
namespace {

constexpr int kPlenty = 60'000;  // milliseconds

struct FreeListener {
  void operator()(bvmh_listener* listener) const { bvmh_listener_free(listener); }
};
using ListenerPointer = std::unique_ptr<bvmh_listener, FreeListener>;

ListenerPointer listenIn(const std::string& directory, unsigned services = BVMH_PUSHES | BVMH_NOTIFICATIONS) {
  bvmh_listener* listener = nullptr;
  EXPECT_EQ(bvmh_listener_create(directory.c_str(), services, &listener), BVMH_OK);
  return ListenerPointer(listener);
}

constexpr const char* kPushes = "/com.norvale.brenvik";
constexpr const char* kNotifications = "/com.norvale.Brenvik.lasd";

// {"Address": "192.0.2.7"} and {"Notification": "com.norvale.lasd.UpdateAvailable", "DBType": "gsm"}
const std::string kAddressList =
    std::string(
        "bplist00\xD1\x01\x02\x57"
        "Address\x59"
        "192.0.2.7\x08\x0B\x13",
        8 + 3 + 8 + 10 + 3) +
    std::string("\0\0\0\0\0\0\1\1\0\0\0\0\0\0\0\3\0\0\0\0\0\0\0\0\0\0\0\0\0\0\0\x1D", 32);

Bytes push(std::int32_t id, std::uint32_t replyPort, std::string_view region) {
  const auto size = static_cast<std::uint32_t>(region.size());
  return Bytes(56)
      .u32(0, 0x80000012)
      .u32(4, 52)
      .u32(8, replyPort)
      .i32(20, id)
      .u32(24, 1)
      .u64(28, 56)
      .u8(36, 0)
      .u8(37, 1)
      .u8(39, 1)
      .u32(40, size)
      .ndr(44)
      .append(region);
}

void send(const UniqueFd& socket, const Bytes& bytes, const std::vector<int>& descriptors = {}) {
  Script wire;
  EXPECT_TRUE(wire.send(socket, bytes, descriptors));
}

Message receive(const UniqueFd& socket) {
  Script wire;
  return wire.receive(socket);
}

class ListenerTest : public testing::Test {
 protected:
  void SetUp() override { before_ = openDescriptors(); }
  void TearDown() override {
    listener_.reset();
    // A listener that goes does not wait for its unaccepted connections: another thread closes them.
    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(kPlenty);
    while (openDescriptors() != before_ && std::chrono::steady_clock::now() < end) std::this_thread::yield();
    EXPECT_EQ(openDescriptors(), before_);
  }

  void listen(unsigned services = BVMH_PUSHES | BVMH_NOTIFICATIONS) {
    listener_ = listenIn(directory_.path(), services);
  }
  UniqueFd connect(const char* service) { return connectTo(directory_.path() + service); }
  // The next event's payload; fails the test when there is none.
  std::string next(bvmh_event_kind kind) {
    bvmh_event_free(&event_);
    EXPECT_EQ(bvmh_listener_next(listener_.get(), kPlenty, &event_), BVMH_OK);
    EXPECT_EQ(event_.kind, kind);
    return {static_cast<const char*>(event_.payload.bytes), event_.payload.size};
  }
  ~ListenerTest() override { bvmh_event_free(&event_); }

  TemporaryDirectory directory_;
  ListenerPointer listener_;
  bvmh_event event_{};

  std::size_t before_ = 0;
};

TEST_F(ListenerTest, HandsOverAPushAndSendsItsReply) {
  listen();
  const UniqueFd helper = connect(kPushes);
  send(helper, push(9100002, 77, kAddressList));
  EXPECT_EQ(next(BVMH_EVENT_LOCAL_ADDRESS), kAddressList);
  EXPECT_TRUE(event_.wants_reply);
  EXPECT_EQ(event_.sender_uid, ::geteuid());
  EXPECT_EQ(event_.sender_pid, ::getpid());
  char address[32];
  EXPECT_EQ(bvmh_event_text(&event_, "Address", address, sizeof address), 9);
  EXPECT_STREQ(address, "192.0.2.7");
  EXPECT_EQ(bvmh_listener_reply(listener_.get(), &event_, 0, 0), BVMH_OK);
  const Message reply = receive(helper);
  EXPECT_EQ(reply.bytes, Bytes(44).u32(0, 18).u32(4, 44).u32(12, 77).i32(20, 9100102).ndr(24));
  bvmh_event_free(&event_);
}

TEST_F(ListenerTest, ARefusalCarriesDomainAndCode) {
  listen();
  const UniqueFd helper = connect(kPushes);
  send(helper, push(9100001, 5, "civic"));
  EXPECT_EQ(next(BVMH_EVENT_CIVIC_INFO), "civic");
  EXPECT_EQ(bvmh_listener_reply(listener_.get(), &event_, 2, 13), BVMH_OK);
  const Message reply = receive(helper);
  EXPECT_EQ(
      reply.bytes,
      Bytes(44).u32(0, 18).u32(4, 44).u32(12, 5).i32(20, 9100101).ndr(24).i32(32, 13).i32(36, 2).i32(40, 13));
  bvmh_event_free(&event_);
}

TEST_F(ListenerTest, TakesAPushFromSealedMemory) {
  listen();
  const UniqueFd helper = connect(kPushes);
  const std::string large(200'000, 'p');
  {
    const UniqueFd memory = makeMemory(large, kAllSeals);
    Bytes request(push(9100001, 5, "").string().substr(0, 52));
    send(helper, request.u64(28, 0).u32(40, 200'000), {memory.get()});
  }
  EXPECT_EQ(next(BVMH_EVENT_CIVIC_INFO), large);
  bvmh_event_free(&event_);
}

TEST_F(ListenerTest, HandsOverNotificationsOfASenderThatIsGone) {
  listen();
  for (const char* text : {"one", "two"}) {
    const UniqueFd helper = connect(kNotifications);
    send(helper, Bytes(24).u32(4, 24).append(text));
  }
  EXPECT_EQ(next(BVMH_EVENT_NOTIFICATION), "one");
  EXPECT_FALSE(event_.wants_reply);
  EXPECT_EQ(bvmh_listener_reply(listener_.get(), &event_, 0, 0), BVMH_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(next(BVMH_EVENT_NOTIFICATION), "two");
  bvmh_event_free(&event_);
}

TEST_F(ListenerTest, ReportsThatNoOneWaitsForTheReplyAnyMore) {
  listen();
  bvmh_event abandoned{};
  {
    const UniqueFd helper = connect(kPushes);
    send(helper, push(9100001, 5, "x"));
    EXPECT_EQ(next(BVMH_EVENT_CIVIC_INFO), "x");
    abandoned = event_;
    event_ = {};
  }
  EXPECT_EQ(bvmh_listener_reply(listener_.get(), &abandoned, 0, 0), BVMH_ERROR_NO_LONGER_THERE);
  EXPECT_EQ(bvmh_listener_next(listener_.get(), 0, &event_), BVMH_ERROR_TIMED_OUT);
  EXPECT_EQ(bvmh_listener_reply(listener_.get(), &abandoned, 0, 0), BVMH_ERROR_NO_LONGER_THERE);
  bvmh_event_free(&abandoned);
}

TEST_F(ListenerTest, APushThatWantsNoReplyGetsNone) {
  listen();
  const UniqueFd helper = connect(kPushes);
  send(helper, push(9100001, 0, "x"));
  EXPECT_EQ(next(BVMH_EVENT_CIVIC_INFO), "x");
  EXPECT_FALSE(event_.wants_reply);
  bvmh_event_free(&event_);
}

TEST_F(ListenerTest, AnswersBrokenMessagesAndSkipsThem) {
  listen();
  const UniqueFd helper = connect(kPushes);
  const auto refusedWith = [&](std::int32_t code, const Bytes& bytes,
                               const std::vector<int>& descriptors = {}) {
    send(helper, bytes, descriptors);
    EXPECT_EQ(bvmh_listener_next(listener_.get(), 0, &event_), BVMH_ERROR_TIMED_OUT);
    const Message reply = receive(helper);
    EXPECT_EQ(reply.bytes, Bytes(36)
                               .u32(0, 18)
                               .u32(4, 36)
                               .u32(12, bytes.u32At(8))
                               .i32(20, bytes.i32At(20) + 100)
                               .ndr(24)
                               .i32(32, code));
  };
  const Bytes good = push(9100001, 5, "0123456789");
  refusedWith(-303, Bytes(good).i32(20, 9100003));
  refusedWith(-303, Bytes(good).i32(20, 0));
  refusedWith(-304, Bytes(good).u32(0, 18));
  refusedWith(-304, Bytes(good.string().substr(0, 51)));
  refusedWith(-304, Bytes(good).u32(24, 2));
  refusedWith(-300, Bytes(good).u8(39, 0));
  refusedWith(-304, Bytes(good).u64(28, 64));
  refusedWith(-304, Bytes(good).u32(40, 9));
  refusedWith(-304, Bytes(good).u32(40, 11));
  refusedWith(-304, Bytes(good).u32(4, 60));
  refusedWith(-304, Bytes(good), {STDIN_FILENO});
  refusedWith(-304, Bytes(good).append(std::string(65'536, 'x')));
  const UniqueFd unsealed = makeMemory("0123456789", 0);
  refusedWith(-304, Bytes(good.string().substr(0, 52)).u64(28, 0), {unsealed.get()});
  send(helper, Bytes(23));
  send(helper, good);
  EXPECT_EQ(next(BVMH_EVENT_CIVIC_INFO), "0123456789");
  const UniqueFd notifier = connect(kNotifications);
  send(notifier, Bytes(24).i32(20, 1));
  send(notifier, Bytes(24), {STDIN_FILENO});
  send(notifier, Bytes(24).append("n"));
  EXPECT_EQ(next(BVMH_EVENT_NOTIFICATION), "n");
  bvmh_event_free(&event_);
}

TEST_F(ListenerTest, WaitsNoLongerThanItIsTold) {
  listen();
  const UniqueFd silent = connect(kPushes);
  EXPECT_EQ(bvmh_listener_next(listener_.get(), 0, &event_), BVMH_ERROR_TIMED_OUT);
  EXPECT_EQ(bvmh_listener_next(listener_.get(), 20, &event_), BVMH_ERROR_TIMED_OUT);
  EXPECT_EQ(event_.kind, BVMH_EVENT_NONE);
}

TEST_F(ListenerTest, ToldToWaitForEverItWaitsForTheNextEvent) {
  listen();
  UniqueFd helper = connect(kNotifications);
  std::thread later([&helper] {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    send(helper, Bytes(24).append("at last"));
  });
  EXPECT_EQ(bvmh_listener_next(listener_.get(), -1, &event_), BVMH_OK);
  later.join();
  EXPECT_EQ(std::string(static_cast<const char*>(event_.payload.bytes), event_.payload.size), "at last");
  bvmh_event_free(&event_);
}

TEST_F(ListenerTest, ItsDescriptorTellsWhenThereIsSomething) {
  listen();
  pollfd entry{bvmh_listener_fd(listener_.get()), POLLIN, 0};
  EXPECT_EQ(::poll(&entry, 1, 0), 0);
  const UniqueFd helper = connect(kNotifications);
  send(helper, Bytes(24).append("x"));
  EXPECT_EQ(::poll(&entry, 1, kPlenty), 1);
  EXPECT_EQ(next(BVMH_EVENT_NOTIFICATION), "x");
  bvmh_event_free(&event_);
}

TEST_F(ListenerTest, SilentConnectionsMakeRoomForNewOnes) {
  listen();
  std::vector<UniqueFd> silent;
  for (int i = 0; i < 100; ++i) {
    silent.push_back(connect(kPushes));
    ASSERT_EQ(bvmh_listener_next(listener_.get(), 0, &event_), BVMH_ERROR_TIMED_OUT);
  }
  const UniqueFd helper = connect(kPushes);
  send(helper, push(9100001, 5, "x"));
  EXPECT_EQ(next(BVMH_EVENT_CIVIC_INFO), "x");
  EXPECT_EQ(bvmh_listener_reply(listener_.get(), &event_, 0, 0), BVMH_OK);
  // The first ones were let go.
  char byte = 0;
  EXPECT_EQ(::recv(silent.front().get(), &byte, 1, MSG_DONTWAIT), 0);
  EXPECT_EQ(::recv(silent.back().get(), &byte, 1, MSG_DONTWAIT), -1);
  bvmh_event_free(&event_);
}

TEST_F(ListenerTest, MakesItsFolderAndLeavesNoSocketBehind) {
  const std::string inner = directory_.path() + "/run/bootstrap";
  listener_ = listenIn(inner);
  struct stat facts {};
  ASSERT_EQ(::lstat((inner + kPushes).c_str(), &facts), 0);
  EXPECT_TRUE(S_ISSOCK(facts.st_mode));
  EXPECT_EQ(facts.st_mode & 07777, 0666U);
  ASSERT_EQ(::lstat((inner + kNotifications).c_str(), &facts), 0);
  listener_.reset();
  EXPECT_NE(::lstat((inner + kPushes).c_str(), &facts), 0);
  EXPECT_NE(::lstat((inner + kNotifications).c_str(), &facts), 0);
}

TEST_F(ListenerTest, ServesOnlyTheServicesAskedFor) {
  listen(BVMH_NOTIFICATIONS);
  struct stat facts {};
  EXPECT_NE(::lstat((directory_.path() + kPushes).c_str(), &facts), 0);
  EXPECT_EQ(::lstat((directory_.path() + kNotifications).c_str(), &facts), 0);
  bvmh_listener* none = nullptr;
  EXPECT_EQ(bvmh_listener_create(directory_.path().c_str(), 0, &none), BVMH_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(bvmh_listener_create(directory_.path().c_str(), 4, &none), BVMH_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(bvmh_listener_create((directory_.path() + std::string(100, 'x')).c_str(), 1, &none),
            BVMH_ERROR_INVALID_ARGUMENT);
}

TEST_F(ListenerTest, OutOfDescriptorsAConnectionWaitsAndTheReasonIsTold) {
  listen();
  const UniqueFd helper = connect(kNotifications);
  send(helper, Bytes(24).append("late"));
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
  const rlimit none{0, before.rlim_max};  // what is open stays open
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
  const std::int32_t code = bvmh_listener_next(listener_.get(), kPlenty, &event_);
  const int reason = bvmh_listener_errno(listener_.get());
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
  EXPECT_EQ(code, BVMH_ERROR_SYSTEM);
  EXPECT_EQ(reason, EMFILE);
  EXPECT_EQ(next(BVMH_EVENT_NOTIFICATION), "late");
}

TEST_F(ListenerTest, AFolderThatCannotBeMadeIsTold) {
  const std::string file = directory_.path() + "/file";
  ASSERT_TRUE(UniqueFd(::creat(file.c_str(), 0600)).isValid());
  bvmh_listener* none = nullptr;
  EXPECT_EQ(bvmh_listener_create((file + "/below").c_str(), BVMH_PUSHES, &none), BVMH_ERROR_SYSTEM);
  EXPECT_EQ(errno, ENOTDIR);
  EXPECT_EQ(none, nullptr);
}

TEST_F(ListenerTest, AFolderThatVanishedIsToldOnceAndWhoIsConnectedIsStillServed) {
  listen();
  const UniqueFd helper = connect(kPushes);
  EXPECT_EQ(bvmh_listener_next(listener_.get(), 0, &event_), BVMH_ERROR_TIMED_OUT);
  ASSERT_EQ(::unlink((directory_.path() + kPushes).c_str()), 0);
  ASSERT_EQ(::unlink((directory_.path() + kNotifications).c_str()), 0);
  ASSERT_EQ(::rmdir(directory_.path().c_str()), 0);
  pollfd ready{bvmh_listener_fd(listener_.get()), POLLIN, 0};
  EXPECT_EQ(::poll(&ready, 1, kPlenty), 1);
  EXPECT_EQ(bvmh_listener_next(listener_.get(), kPlenty, &event_), BVMH_ERROR_NAME_LOST);
  EXPECT_EQ(event_.kind, BVMH_EVENT_NONE);
  EXPECT_EQ(bvmh_listener_next(listener_.get(), 0, &event_), BVMH_ERROR_TIMED_OUT);
  send(helper, push(9100002, 77, kAddressList));
  EXPECT_EQ(next(BVMH_EVENT_LOCAL_ADDRESS), kAddressList);
  // Another one can be made in its place.
  listener_.reset();
  listen();
  EXPECT_TRUE(connect(kPushes).isValid());
}

TEST_F(ListenerTest, OfTwoServicesEachTellsThatItsNameWasMoved) {
  listen();
  for (const char* each : {kPushes, kNotifications}) {
    const std::string path = directory_.path() + each;
    ASSERT_EQ(::rename(path.c_str(), (path + ".old").c_str()), 0);
    EXPECT_EQ(bvmh_listener_next(listener_.get(), kPlenty, &event_), BVMH_ERROR_NAME_LOST);
    EXPECT_EQ(bvmh_listener_next(listener_.get(), 0, &event_), BVMH_ERROR_TIMED_OUT);
  }
}

TEST_F(ListenerTest, AChangedModeIsNoLostName) {
  listen();
  ASSERT_EQ(::chmod((directory_.path() + kPushes).c_str(), 0600), 0);
  EXPECT_EQ(bvmh_listener_next(listener_.get(), 0, &event_), BVMH_ERROR_TIMED_OUT);
}

TEST_F(ListenerTest, ALiveNameIsLeftAloneAndAStaleOneReplaced) {
  listen();
  bvmh_listener* second = nullptr;
  EXPECT_EQ(bvmh_listener_create(directory_.path().c_str(), BVMH_PUSHES, &second), BVMH_ERROR_NAME_IN_USE);
  EXPECT_EQ(second, nullptr);
  const UniqueFd helper = connect(kPushes);  // the first one still has it
  listener_.reset();

  {
    const UniqueFd dead(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = directory_.path() + kPushes;
    std::memcpy(address.sun_path, path.data(), path.size());
    ASSERT_EQ(::bind(dead.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  }
  listen();
  const UniqueFd again = connect(kPushes);
}

TEST_F(ListenerTest, DoesNotRemoveASocketThatTookItsPlace) {
  listen(BVMH_PUSHES);
  const std::string path = directory_.path() + kPushes;
  ASSERT_EQ(::unlink(path.c_str()), 0);
  const ListenerPointer second = listenIn(directory_.path(), BVMH_PUSHES);
  listener_.reset();
  const UniqueFd helper = connect(kPushes);
}

// A listening socket of a named service, as a service manager makes it.
UniqueFd listeningAt(const std::string& path, int type = SOCK_SEQPACKET) {
  UniqueFd socket(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.data(), path.size());
  EXPECT_EQ(::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  EXPECT_EQ(::listen(socket.get(), 4), 0);
  return socket;
}

TEST_F(ListenerTest, ServesSocketsThatSomebodyElseMadeAndLeavesTheirFiles) {
  UniqueFd pushes = listeningAt(directory_.path() + kPushes);
  UniqueFd notifications = listeningAt(directory_.path() + kNotifications);
  bvmh_listener* made = nullptr;
  ASSERT_EQ(bvmh_listener_create_from_fds(pushes.get(), notifications.get(), &made), BVMH_OK);
  listener_.reset(made);
  EXPECT_EQ(::fcntl(pushes.get(), F_GETFD), FD_CLOEXEC);
  EXPECT_NE(::fcntl(pushes.get(), F_GETFL) & O_NONBLOCK, 0);
  (void)pushes.release();
  (void)notifications.release();

  const UniqueFd helper = connect(kPushes);
  send(helper, push(9100002, 77, kAddressList));
  EXPECT_EQ(next(BVMH_EVENT_LOCAL_ADDRESS), kAddressList);
  const UniqueFd updater = connect(kNotifications);
  send(updater, Bytes(24).append("news"));
  EXPECT_EQ(next(BVMH_EVENT_NOTIFICATION), "news");
  bvmh_event_free(&event_);

  listener_.reset();
  EXPECT_EQ(::access((directory_.path() + kPushes).c_str(), F_OK), 0);
  EXPECT_EQ(::access((directory_.path() + kNotifications).c_str(), F_OK), 0);
}

TEST_F(ListenerTest, OneOfTheTwoSocketsIsEnough) {
  UniqueFd pushes = listeningAt(directory_.path() + kPushes);
  bvmh_listener* made = nullptr;
  ASSERT_EQ(bvmh_listener_create_from_fds(pushes.get(), -1, &made), BVMH_OK);
  listener_.reset(made);
  (void)pushes.release();
  const UniqueFd helper = connect(kPushes);
  send(helper, push(9100002, 77, kAddressList));
  EXPECT_EQ(next(BVMH_EVENT_LOCAL_ADDRESS), kAddressList);
  bvmh_event_free(&event_);
}

TEST_F(ListenerTest, AForeignDescriptorHandedOverAsAServiceSocketIsRefusedAndStaysTheCallers) {
  const UniqueFd good = listeningAt(directory_.path() + kPushes);
  const UniqueFd stream = listeningAt(directory_.path() + "/stream", SOCK_STREAM);
  const UniqueFd file(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  const UniqueFd quiet(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  const UniqueFd internet(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  bvmh_listener* made = nullptr;
  for (const int wrong : {stream.get(), file.get(), quiet.get(), internet.get(), good.get(), -2, 1 << 20}) {
    SCOPED_TRACE(wrong);
    EXPECT_EQ(bvmh_listener_create_from_fds(good.get(), wrong, &made), BVMH_ERROR_INVALID_ARGUMENT);
    EXPECT_EQ(made, nullptr);
  }
  EXPECT_EQ(bvmh_listener_create_from_fds(-1, -1, &made), BVMH_ERROR_INVALID_ARGUMENT);
  for (const UniqueFd* each : {&good, &stream, &file, &quiet, &internet}) {
    EXPECT_NE(::fcntl(each->get(), F_GETFD), -1) << "it was closed";
  }
}

// Runs the work in a process to which a service manager has handed the sockets, from descriptor 3 on. Its
// exit status.
template <class Work>
int inProcessHandedOver(const std::vector<int>& sockets, const char* names, pid_t* other, Work work) {
  const pid_t child = ::fork();
  if (child == 0) {
    // Out of the way of the places that they are to have.
    std::vector<int> copies;
    for (const int each : sockets) copies.push_back(::fcntl(each, F_DUPFD, 100));
    for (std::size_t i = 0; i < copies.size(); ++i) ::dup2(copies[i], static_cast<int>(3 + i));
    ::setenv("LISTEN_PID", std::to_string(other != nullptr ? *other : ::getpid()).c_str(), 1);
    ::setenv("LISTEN_FDS", std::to_string(sockets.size()).c_str(), 1);
    ::setenv("LISTEN_FDNAMES", names, 1);
    ::_exit(work());
  }
  int status = 0;
  EXPECT_EQ(::waitpid(child, &status, 0), child);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST_F(ListenerTest, FindsTheSocketsOfAServiceManagerByTheirNames) {
  const UniqueFd other = listeningAt(directory_.path() + "/other");
  const UniqueFd pushes = listeningAt(directory_.path() + kPushes);
  const UniqueFd notifications = listeningAt(directory_.path() + kNotifications);
  const UniqueFd helper = connect(kPushes);
  send(helper, push(9100002, 77, kAddressList));
  const UniqueFd updater = connect(kNotifications);
  send(updater, Bytes(24).append("news"));
  const auto work = [] {
    bvmh_listener* made = nullptr;
    if (bvmh_listener_create_from_environment(BVMH_PUSHES | BVMH_NOTIFICATIONS, &made) != BVMH_OK) return 1;
    unsigned seen = 0;
    for (int i = 0; i < 2; ++i) {
      bvmh_event event{};
      if (bvmh_listener_next(made, kPlenty, &event) != BVMH_OK) return 2;
      seen |= 1U << event.kind;
      bvmh_event_free(&event);
    }
    bvmh_listener_free(made);
    if (::fcntl(3, F_GETFD) == -1) return 3;  // that of another name
    return seen == (1U << BVMH_EVENT_LOCAL_ADDRESS | 1U << BVMH_EVENT_NOTIFICATION) ? 0 : 4;
  };
  EXPECT_EQ(inProcessHandedOver({other.get(), notifications.get(), pushes.get()},
                                "other:com.norvale.Brenvik.lasd:com.norvale.brenvik", nullptr, work),
            0);
}

TEST_F(ListenerTest, SocketsThatWereHandedToNobodyOrSomebodyElseAreNotTaken) {
  const UniqueFd pushes = listeningAt(directory_.path() + kPushes);
  const auto notHandedOver = [] {
    bvmh_listener* made = nullptr;
    const std::int32_t code = bvmh_listener_create_from_environment(BVMH_PUSHES | BVMH_NOTIFICATIONS, &made);
    return code == BVMH_ERROR_NOT_HANDED_OVER && made == nullptr && ::fcntl(3, F_GETFD) != -1 ? 0 : 1;
  };
  const std::vector<int> one{pushes.get()};
  pid_t somebody = ::getpid();
  EXPECT_EQ(inProcessHandedOver(one, "com.norvale.brenvik", &somebody, notHandedOver), 0);
  EXPECT_EQ(inProcessHandedOver(one, "com.norvale.brenvik.mobile-helper", nullptr, notHandedOver), 0);
  EXPECT_EQ(inProcessHandedOver(one, "", nullptr, notHandedOver), 0);
  // More names than descriptors.
  EXPECT_EQ(inProcessHandedOver(one, "other:com.norvale.brenvik", nullptr, notHandedOver), 0);
  const auto wantsTheOther = [] {
    bvmh_listener* made = nullptr;
    return bvmh_listener_create_from_environment(BVMH_NOTIFICATIONS, &made) == BVMH_ERROR_NOT_HANDED_OVER ? 0
                                                                                                          : 1;
  };
  EXPECT_EQ(inProcessHandedOver(one, "com.norvale.brenvik", nullptr, wantsTheOther), 0);
}

TEST_F(ListenerTest, OtherUsersAreTurnedAwayUnlessAllowed) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs the superuser to become somebody else";
  ASSERT_EQ(::chmod(directory_.path().c_str(), 0755), 0);
  listen();
  constexpr uid_t kStranger = 54321;
  const auto sendAsStranger = [&] {
    const pid_t child = ::fork();
    if (child == 0) {
      if (::setresuid(kStranger, kStranger, kStranger) != 0) ::_exit(2);
      const UniqueFd socket = connectTo(directory_.path() + kNotifications);
      Script wire;
      wire.send(socket, Bytes(24).append("stranger"));
      ::_exit(0);
    }
    int status = 0;
    EXPECT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
  };
  sendAsStranger();
  EXPECT_EQ(bvmh_listener_next(listener_.get(), 0, &event_), BVMH_ERROR_TIMED_OUT);
  bvmh_listener_allow_uid(listener_.get(), kStranger);
  sendAsStranger();
  EXPECT_EQ(next(BVMH_EVENT_NOTIFICATION), "stranger");
  EXPECT_EQ(event_.sender_uid, kStranger);
  bvmh_event_free(&event_);
}

// A TCP socket whose last close waits an hour, because nobody reads what it has sent.
UniqueFd lingeringSocket(UniqueFd* listening) {
  *listening = UniqueFd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const int small = 1;
  ::setsockopt(listening->get(), SOL_SOCKET, SO_RCVBUF, &small, sizeof small);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = ::htonl(INADDR_LOOPBACK);
  socklen_t size = sizeof address;
  auto* const generic = reinterpret_cast<sockaddr*>(&address);
  EXPECT_EQ(::bind(listening->get(), generic, size), 0);
  EXPECT_EQ(::listen(listening->get(), 1), 0);
  EXPECT_EQ(::getsockname(listening->get(), generic, &size), 0);
  UniqueFd made(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  ::setsockopt(made.get(), SOL_SOCKET, SO_SNDBUF, &small, sizeof small);
  EXPECT_EQ(::connect(made.get(), generic, size), 0);
  const linger hour{1, 3600};
  ::setsockopt(made.get(), SOL_SOCKET, SO_LINGER, &hour, sizeof hour);
  const std::array<char, 65536> bytes{};
  while (::send(made.get(), bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_NOSIGNAL) > 0) {
  }
  return made;
}

TEST_F(ListenerTest, WhatAStrangerSentBeforeItWasAcceptedDoesNotHoldUpTheEnd) {
  for (const bool isHandedOver : {false, true}) {
    if (isHandedOver) {
      bvmh_listener* made = nullptr;
      ASSERT_EQ(bvmh_listener_create_from_fds(listeningAt(directory_.path() + kPushes).release(), -1, &made),
                BVMH_OK);
      listener_.reset(made);
    } else {
      listen();
    }
    UniqueFd listening;
    UniqueFd lingering = lingeringSocket(&listening);
    UniqueFd reader(::accept4(listening.get(), nullptr, nullptr, SOCK_CLOEXEC));
    UniqueFd socket = connect(kPushes);
    Script wire;
    wire.send(socket, Bytes(24), {lingering.get()});
    lingering.reset();
    socket.reset();  // what it has sent is the listening socket's alone
    const auto began = std::chrono::steady_clock::now();
    listener_.reset();
    EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::seconds(10)) << "and not an hour";
    reader.reset();  // a reset: nothing is left to wait for
    listening.reset();
    while (openDescriptors() > before_) std::this_thread::yield();
  }
}

TEST_F(ListenerTest, WhatAStrangerSendsAlongHoldsUpNobody) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs the superuser to become somebody else";
  ASSERT_EQ(::chmod(directory_.path().c_str(), 0755), 0);
  // Whoever waits for a close is here, and the test ends it by reading.
  std::array<UniqueFd, TurnedAway::kMaxThreads> readers;
  listen();
  const auto open = openDescriptors();
  const auto connectAsStranger = [&](UniqueFd& reader) {
    UniqueFd listening;
    UniqueFd lingering = lingeringSocket(&listening);
    reader.reset(::accept4(listening.get(), nullptr, nullptr, SOCK_CLOEXEC));
    const pid_t child = ::fork();
    if (child == 0) {
      if (::setresuid(54321, 54321, 54321) != 0) ::_exit(2);
      const UniqueFd socket = connectTo(directory_.path() + kNotifications);
      Script wire;
      wire.send(socket, Bytes(24), {lingering.get()});
      ::_exit(0);
    }
    int status = 0;
    EXPECT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
  };
  for (UniqueFd& reader : readers) connectAsStranger(reader);
  EXPECT_EQ(bvmh_listener_next(listener_.get(), 0, &event_), BVMH_ERROR_TIMED_OUT) << "and not in an hour";
  // All threads are busy, so nobody is let in until one has done.
  Script wire;
  const UniqueFd friendly = connect(kNotifications);
  wire.send(friendly, Bytes(24).append("waits"));
  EXPECT_EQ(bvmh_listener_next(listener_.get(), 0, &event_), BVMH_ERROR_TIMED_OUT);
  readers.front().reset();  // a reset: nothing is left to wait for
  EXPECT_EQ(next(BVMH_EVENT_NOTIFICATION), "waits");
  readers = {};
  while (openDescriptors() > open + 2) std::this_thread::yield();
}

}  // namespace
}  // namespace brenvik::client
