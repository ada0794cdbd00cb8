// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/worker/linux/WorkerProgram.h"

#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/ProcessFacts.h"
#include "platform/base/fakes/FailingAllocations.h"
#include "platform/base/fakes/LingeringSocket.h"
#include "platform/datagram/SealedMemory.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/log/fakes/RecordingLog.h"
#include "platform/worker/WorkerFields.h"
#include "platform/worker/linux/WorkerHost.h"
#include "platform/worker/linux/WorkerRights.h"
#include "testing/Works.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

constexpr const char* kService = "org.test.worker";

// Not in a user namespace that knows one only.
bool hasManyAccounts() {
  std::ifstream map("/proc/self/uid_map");
  std::uint64_t inside = 0;
  std::uint64_t outside = 0;
  std::uint64_t count = 0;
  return static_cast<bool>(map >> inside >> outside >> count) && inside == 0 && count > 65534;
}

// Runs work() as root of such a namespace; it answers 0 when all is well.
void inANamespaceWithOneAccount(const std::function<int()>& work) {
  const uid_t uid = ::geteuid();
  const gid_t gid = ::getegid();
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (::unshare(CLONE_NEWUSER) != 0) ::_exit(77);
    std::ofstream("/proc/self/setgroups") << "deny";
    std::ofstream("/proc/self/uid_map") << "0 " << uid << " 1";
    std::ofstream("/proc/self/gid_map") << "0 " << gid << " 1";
    ::_exit(work());
  }
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  if (WIFEXITED(status) && WEXITSTATUS(status) == 77) GTEST_SKIP() << "no user namespaces to be had";
  EXPECT_EQ(status, 0);
}

std::vector<pid_t> children() {
  std::vector<pid_t> found;
  std::ifstream list("/proc/thread-self/children");
  for (pid_t pid = 0; list >> pid;) found.push_back(pid);
  return found;
}

// Waits until the child has ended. It may have been reaped already.
void waitForEnd(pid_t child) {
  siginfo_t info{};
  while (::waitid(P_PID, static_cast<id_t>(child), &info, WEXITED | WNOWAIT) != 0 && errno == EINTR) {
  }
}

class WorkerProgramTest : public testing::Test {
 protected:
  // A child that was killed may end later than its owner waits; the next test begins without any.
  void TearDown() override {
    while (::waitpid(-1, nullptr, 0) > 0) {
    }
  }
  WorkerProgram::Description description(std::vector<std::string> folders = {}) {
    return {.service = kService,
            .program = "worker_for_tests",
            .bootstrap = folder.path(),
            .folders = std::move(folders)};
  }
  static WorkerResult open(WorkerProgram& worker, WorkForTests work, WorkerChannel* channel) {
    return worker.open(static_cast<std::uint32_t>(work), channel);
  }
  WorkerResult receive(WorkerChannel& channel) { return channel.receive(&message, Clock::now() + 20s); }
  // What an echo says: the channel works.
  bool echoes(WorkerChannel& channel, std::uint32_t kind = 42) {
    return channel.send({.kind = kind, .payload = {}, .descriptors = {}}) == WorkerResult::done &&
           receive(channel) == WorkerResult::done && message.kind == kind;
  }
  bool works(WorkerProgram& worker) {
    WorkerChannel channel;
    return open(worker, WorkForTests::echo, &channel) == WorkerResult::done && echoes(channel);
  }
  void die(WorkerProgram& worker) {
    WorkerChannel channel;
    ASSERT_EQ(open(worker, WorkForTests::die, &channel), WorkerResult::done);
    ASSERT_EQ(channel.send({}), WorkerResult::done);
    EXPECT_EQ(receive(channel), WorkerResult::closed);
    const std::vector<pid_t> before = children();
    worker.giveUp(&channel);
    for (const pid_t child : before) waitForEnd(child);  // a busy machine takes longer than giveUp() waits
  }
  // A report of what the worker has, in `message`.
  WorkerResult askForReport() {
    WorkerProgram worker(description());
    WorkerChannel channel;
    const WorkerResult opened = open(worker, WorkForTests::report, &channel);
    return opened == WorkerResult::done ? receive(channel) : opened;
  }
  std::vector<std::string> lines() const {
    std::vector<std::string> texts;
    for (const auto& entry : log.entries()) texts.push_back(entry.line);
    return texts;
  }

  TemporaryDirectory folder;
  RecordingLog log;
  WorkerMessage message;
};

TEST_F(WorkerProgramTest, WhereNobodyListensTheProgramBesideThisOneIsStartedOnce) {
  WorkerProgram worker(description());
  EXPECT_TRUE(children().empty()) << "not before it is needed";
  WorkerChannel one;
  WorkerChannel other;
  ASSERT_EQ(open(worker, WorkForTests::echo, &one), WorkerResult::done);
  ASSERT_EQ(open(worker, WorkForTests::echo, &other), WorkerResult::done);
  EXPECT_TRUE(echoes(one, 1));
  EXPECT_TRUE(echoes(other, 2));
  EXPECT_TRUE(echoes(one, 3));
  EXPECT_EQ(children().size(), 1U);
  EXPECT_EQ(lines(), std::vector<std::string>());
}

TEST_F(WorkerProgramTest, AWorkerThatWasStartedAheadIsTheOneThatIsOpened) {
  WorkerProgram worker(description());
  worker.start();
  ASSERT_EQ(children().size(), 1U);
  const pid_t child = children()[0];
  worker.start();
  EXPECT_TRUE(works(worker));
  EXPECT_EQ(children(), std::vector<pid_t>{child});
  die(worker);
  worker.start();
  EXPECT_EQ(children().size(), 1U) << "a new one for the one that died";
}

TEST_F(WorkerProgramTest, AWorkerThatDiesBeforeItsFirstUseIsReplacedAtThatUse) {
  WorkerProgram worker(description());
  worker.start();
  ASSERT_EQ(children().size(), 1U);
  ASSERT_EQ(::kill(children()[0], SIGKILL), 0);
  waitForEnd(children()[0]);
  EXPECT_TRUE(works(worker));
  EXPECT_EQ(children().size(), 1U);
}

TEST_F(WorkerProgramTest, AWorkerThatCannotBeStartedAheadIsToldOnlyByTheOpenThatNeedsIt) {
  WorkerProgram worker(description({folder.path()}));
  worker.start();
  EXPECT_EQ(lines(), std::vector<std::string>());
  WorkerChannel channel;
  EXPECT_EQ(open(worker, WorkForTests::echo, &channel), WorkerResult::unavailable);
  EXPECT_EQ(lines().size(), 1U);
}

TEST_F(WorkerProgramTest, AStartAheadThatLacksMemorySilencesNoLaterLine) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "nothing fails under this sanitizer";
  bool hasFailed = true;
  for (long number = 0; hasFailed; ++number) {
    WorkerProgram worker(description({folder.path()}));
    log.clear();
    {
      const FailingAllocations failing(number, FailingAllocations::HowMany::one);
      worker.start();
    }
    hasFailed = FailingAllocations::failures() > 0;
    EXPECT_EQ(lines(), std::vector<std::string>()) << number;
    WorkerChannel channel;
    EXPECT_EQ(open(worker, WorkForTests::echo, &channel), WorkerResult::unavailable) << number;
    EXPECT_EQ(lines().size(), 1U) << number;
    EXPECT_TRUE(hasFailed || number > 0);
  }
}

TEST_F(WorkerProgramTest, TheWorkerLeavesWithItsOwner) {
  bool isReaped = false;
  for (int i = 0; i < 10 && !isReaped; ++i) {  // a busy machine may take longer than an owner waits
    pid_t child = -1;
    {
      WorkerProgram worker(description());
      ASSERT_TRUE(works(worker));
      ASSERT_EQ(children().size(), 1U);
      child = children()[0];
    }
    isReaped = !processFacts(child).has_value();
    (void)::waitpid(child, nullptr, 0);  // gone, whoever reaps it
  }
  EXPECT_TRUE(isReaped);
}

TEST_F(WorkerProgramTest, AWorkerHasNothingButWhatItWasGiven) {
  ::setenv("BRENVIK_LEAK", "1", 1);
  std::vector<UniqueFd> leaks;  // not closed on exec
  for (int i = 0; i < 10; ++i) leaks.emplace_back(::open("/dev/null", O_RDONLY));
  WorkerProgram worker(description());
  WorkerChannel channel;
  ASSERT_EQ(open(worker, WorkForTests::report, &channel), WorkerResult::done);
  ASSERT_EQ(receive(channel), WorkerResult::done);
  FieldReader reader(message.payload);
  const uid_t uid = reader.u32();
  const gid_t gid = reader.u32();
  const std::string groups(reader.text());
  const std::string capabilities(reader.text());
  const std::string noNewPrivileges(reader.text());
  const std::uint32_t descriptors = reader.u32();
  const std::uint32_t variables = reader.u32();
  const std::uint64_t limit = reader.u64();
  const int internet = static_cast<int>(reader.u32());
  const int netlink = static_cast<int>(reader.u32());
  const int local = static_cast<int>(reader.u32());
  const bool leadsItsSession = reader.boolean();
  const std::string at(reader.text());
  ASSERT_TRUE(reader.whole());
  EXPECT_TRUE(leadsItsSession) << "a terminal on standard error would take commands from it (TIOCSTI)";
  EXPECT_EQ(at, "/") << "a folder that nobody else can walk to is no place to start from";
  EXPECT_EQ(capabilities, "0000000000000000");
  EXPECT_EQ(noNewPrivileges, "1");
  EXPECT_EQ(variables, 0U);
  EXPECT_EQ(limit, 256U);
  EXPECT_EQ(internet, EAFNOSUPPORT);
  EXPECT_EQ(netlink, EAFNOSUPPORT);
  EXPECT_EQ(local, 0);
  // Three standard ones, the connection, this channel, and the journal's socket if it has one.
  EXPECT_LE(descriptors, 6U);
  if (::geteuid() == 0 && hasManyAccounts()) {
    EXPECT_EQ(uid, 65534U);
    EXPECT_EQ(gid, 65534U);
    EXPECT_EQ(groups, "");
  } else {
    EXPECT_EQ(uid, ::getuid());
  }
  ::unsetenv("BRENVIK_LEAK");
}

TEST_F(WorkerProgramTest, SignalsAreNeitherIgnoredNorBlockedBecauseTheyAreHere) {
  sigset_t usual;
  sigset_t blocked;
  ::sigemptyset(&blocked);
  ::sigaddset(&blocked, SIGUSR2);
  ASSERT_EQ(::pthread_sigmask(SIG_BLOCK, &blocked, &usual), 0);
  const auto handler = std::signal(SIGUSR1, SIG_IGN);
  WorkerProgram worker(description());
  EXPECT_TRUE(works(worker));
  (void)std::signal(SIGUSR1, handler);
  ASSERT_EQ(::pthread_sigmask(SIG_SETMASK, &usual, nullptr), 0);
  ASSERT_EQ(children().size(), 1U);
  const auto signals = [&](const std::string& which) {
    std::ifstream status("/proc/" + std::to_string(children()[0]) + "/status");
    for (std::string line; std::getline(status, line);) {
      if (line.starts_with(which)) return std::stoull(line.substr(which.size()), nullptr, 16);
    }
    return ~0ULL;
  };
  // While it starts a thread it blocks them all itself.
  const auto isBlocked = [&] { return (signals("SigBlk:") & (1ULL << (SIGUSR2 - 1))) != 0; };
  for (const auto end = Clock::now() + 5s; isBlocked() && Clock::now() < end;) std::this_thread::yield();
  EXPECT_FALSE(isBlocked());
  EXPECT_EQ(signals("SigIgn:") & (1ULL << (SIGUSR1 - 1)), 0U);
}

TEST_F(WorkerProgramTest, WhatAWorkerSendsIsClosedWhereNobodyWaitsForIt) {
  WorkerProgram worker(description());
  WorkerChannel channel;
  ASSERT_EQ(open(worker, WorkForTests::echo, &channel), WorkerResult::done);
  LingeringSocket lingering(2);
  WorkerMessage sent;
  sent.descriptors.push_back(std::move(lingering.socket));
  ASSERT_EQ(channel.send(sent), WorkerResult::done);
  sent.descriptors.clear();
  WorkerMessage back;
  ASSERT_EQ(channel.receive(&back, Clock::now() + 20s), WorkerResult::done);
  ASSERT_EQ(back.descriptors.size(), 1U);
  ASSERT_TRUE(echoes(channel)) << "so it has let go of the first message";
  const auto before = Clock::now();
  channel.discard(&back);
  EXPECT_LT(Clock::now() - before, 1s);
}

TEST_F(WorkerProgramTest, InANamespaceWithOneAccountThatStaysWithoutACapability) {
  inANamespaceWithOneAccount([&] {
    WorkerProgram worker(description());
    WorkerChannel channel;
    if (open(worker, WorkForTests::report, &channel) != WorkerResult::done) return 2;
    if (receive(channel) != WorkerResult::done) return 3;
    FieldReader reader(message.payload);
    const bool keptAccount = reader.u32() == 0 && reader.u32() == 0;
    (void)reader.text();
    const bool hasNothing = reader.text() == "0000000000000000";
    return keptAccount && hasNothing ? 0 : 4;
  });
}

TEST_F(WorkerProgramTest, AnAccountOfRootsNumberServesOnlyWhereThereIsNoOther) {
  const WorkerRights asRoot{.accounts = {"root"}, .keptCapabilities = {}};
  inANamespaceWithOneAccount([&] {
    const bool goesOn = giveUpRights(asRoot) == nullptr;
    std::ifstream status("/proc/thread-self/status");
    const std::string text((std::istreambuf_iterator<char>(status)), std::istreambuf_iterator<char>());
    const bool hasNothing = text.find("CapPrm:\t0000000000000000") != std::string::npos;
    return goesOn && hasNothing ? 0 : 4;
  });
  if (::geteuid() != 0 || !hasManyAccounts()) return;
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    const char* const why = giveUpRights(asRoot);
    ::_exit(why != nullptr && std::strcmp(why, "the account is root's") == 0 ? 0 : 4);
  }
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
}

TEST_F(WorkerProgramTest, DeathHangsUpAllChannelsAndTheNextOneHasANewWorker) {
  WorkerProgram worker(description());
  WorkerChannel bystander;
  ASSERT_EQ(open(worker, WorkForTests::echo, &bystander), WorkerResult::done);
  ASSERT_TRUE(echoes(bystander));
  die(worker);
  EXPECT_EQ(receive(bystander), WorkerResult::closed);
  EXPECT_TRUE(works(worker));
  EXPECT_EQ(children().size(), 1U) << "the dead one is reaped";
  EXPECT_EQ(log.entries(),
            std::vector({RecordingLog::unifiedLine(LogLevel::error, "worker_for_tests has died")}));
}

TEST_F(WorkerProgramTest, TenDeathsInARowAreFollowedByAWorkerThatWorksAndAFewLines) {
  Clock::time_point now = Clock::now();
  WorkerProgram worker(description(), [&now] { return now; });
  for (int i = 0; i < 10; ++i) die(worker);
  EXPECT_TRUE(works(worker));
  EXPECT_LE(children().size(), 1U);
  EXPECT_EQ(log.entries().size(), static_cast<std::size_t>(WorkerProgram::kLinesInARow));
  now += WorkerProgram::kOneMoreLineEvery;
  die(worker);
  EXPECT_TRUE(works(worker));
  EXPECT_EQ(log.entries().size(), static_cast<std::size_t>(WorkerProgram::kLinesInARow + 1));
}

TEST_F(WorkerProgramTest, AWorkerThatHangsIsEndedAndTheNextOneIsNew) {
  WorkerProgram worker(description());
  WorkerChannel bystander;
  ASSERT_EQ(open(worker, WorkForTests::echo, &bystander), WorkerResult::done);
  WorkerChannel hung;
  ASSERT_EQ(open(worker, WorkForTests::hang, &hung), WorkerResult::done);
  ASSERT_TRUE(echoes(bystander));
  EXPECT_EQ(hung.receive(&message, Clock::now()), WorkerResult::timedOut);
  ASSERT_EQ(children().size(), 1U);
  const pid_t child = children()[0];
  worker.giveUp(&hung);
  EXPECT_FALSE(hung.isOpen());
  EXPECT_EQ(receive(bystander), WorkerResult::closed);
  waitForEnd(child);
  WorkerChannel next;
  ASSERT_EQ(open(worker, WorkForTests::echo, &next), WorkerResult::done);
  ASSERT_EQ(children().size(), 1U) << "reaped at the latest when its successor starts";
  EXPECT_NE(children()[0], child);
  worker.giveUp(&bystander);  // of the one that is gone: the new one stays
  EXPECT_TRUE(echoes(next));
  EXPECT_EQ(lines(),
            std::vector<std::string>({"worker_for_tests does not answer as it should, and is ended"}));
}

TEST_F(WorkerProgramTest, AWorkerThatDiedWhileNobodyLookedIsReplacedAtTheNextOpen) {
  WorkerProgram worker(description());
  ASSERT_TRUE(works(worker));
  ASSERT_EQ(children().size(), 1U);
  ASSERT_EQ(::kill(children()[0], SIGKILL), 0);
  waitForEnd(children()[0]);
  EXPECT_TRUE(works(worker));
  EXPECT_EQ(children().size(), 1U);
  EXPECT_EQ(lines(), std::vector<std::string>({"worker_for_tests has died"}));
}

TEST_F(WorkerProgramTest, AProgramThatIsNotThereIsUnavailableWithItsReason) {
  WorkerProgram worker(description({folder / "nowhere", folder / "neither"}));
  WorkerChannel channel;
  for (int i = 0; i < 10; ++i)
    EXPECT_EQ(open(worker, WorkForTests::echo, &channel), WorkerResult::unavailable);
  EXPECT_FALSE(channel.isOpen());
  ASSERT_EQ(log.entries().size(), static_cast<std::size_t>(WorkerProgram::kLinesInARow));
  EXPECT_EQ(lines()[0], "cannot start worker_for_tests: No such file or directory");
}

TEST_F(WorkerProgramTest, TheSecondFolderServesWhereTheFirstHasNone) {
  WorkerProgram worker(description({folder / "nowhere", workerProgramFolders()[0]}));
  EXPECT_TRUE(works(worker));
}

TEST_F(WorkerProgramTest, AProgramThatLeavesAtOnceHangsUp) {
  const std::string script = folder / "worker_for_tests";
  std::filesystem::create_symlink("/bin/true", script);
  WorkerProgram worker(description({folder.path()}));
  WorkerChannel channel;
  const WorkerResult opened = open(worker, WorkForTests::echo, &channel);
  // The second one may be gone, too, before it is sent anything.
  if (opened == WorkerResult::done) {
    EXPECT_EQ(receive(channel), WorkerResult::closed);
  } else {
    EXPECT_EQ(opened, WorkerResult::unavailable);
  }
}

TEST_F(WorkerProgramTest, SealedMemoryArrivesAndMemoryThatCanChangeIsRefused) {
  WorkerProgram worker(description());
  WorkerChannel channel;
  ASSERT_EQ(open(worker, WorkForTests::sealedMemory, &channel), WorkerResult::done);
  ASSERT_EQ(receive(channel), WorkerResult::done);
  ASSERT_EQ(message.descriptors.size(), 1U);
  SealedMemory memory;
  EXPECT_EQ(SealedMemory::map(message.descriptors[0].get(), 99'999, &memory), EBADMSG);
  EXPECT_EQ(SealedMemory::map(message.descriptors[0].get(), 100'001, &memory), EBADMSG);
  ASSERT_EQ(SealedMemory::map(message.descriptors[0].get(), 100'000, &memory), 0);
  message.descriptors.clear();
  ASSERT_EQ(memory.bytes().size(), 100'000U);
  EXPECT_EQ(memory.bytes().back(), std::byte{'x'});
  const SealedMemory moved = std::move(memory);
  EXPECT_EQ(moved.bytes().front(), std::byte{'x'});

  ASSERT_EQ(open(worker, WorkForTests::openMemory, &channel), WorkerResult::done);
  ASSERT_EQ(receive(channel), WorkerResult::done);
  ASSERT_EQ(message.descriptors.size(), 1U);
  EXPECT_EQ(SealedMemory::map(message.descriptors[0].get(), 100'000, &memory), EBADMSG);
  const UniqueFd file(::open("/etc/passwd", O_RDONLY | O_CLOEXEC));
  EXPECT_EQ(SealedMemory::map(file.get(), 0, &memory), EBADMSG);
}

// ---- behind the socket of the named service

class WorkerServiceTest : public WorkerProgramTest {
 protected:
  // As the service manager's socket unit does.
  UniqueFd listen(int type = SOCK_SEQPACKET, int backlog = 1) {
    const sockaddr_un address = this->address();
    UniqueFd socket(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
    EXPECT_EQ(::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    EXPECT_EQ(::listen(socket.get(), backlog), 0);
    return socket;
  }
  sockaddr_un address() const {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = folder / kService;
    std::strcpy(address.sun_path, path.c_str());
    return address;
  }
  // As a helper does.
  WorkerChannel connect() const {
    const sockaddr_un address = this->address();
    UniqueFd socket(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    EXPECT_EQ(::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    return WorkerChannel(std::move(socket));
  }
  static WorkerResult openOn(WorkerChannel& connection, WorkerChannel* channel,
                             WorkForTests work = WorkForTests::echo) {
    WorkerChannel theirs;
    EXPECT_EQ(WorkerChannel::makePair(channel, &theirs), WorkerResult::done);
    WorkerMessage opening;
    opening.kind = static_cast<std::uint32_t>(work);
    opening.descriptors.push_back(theirs.release());
    return connection.send(opening);
  }
  // The worker as the service manager starts it, with the listening socket.
  pid_t startAsService(const UniqueFd& socket) {
    const std::string path = workerProgramFolders()[0] + "/worker_for_tests";
    const std::string names = std::string("LISTEN_FDNAMES=") + kService;
    const pid_t child = ::fork();
    if (child != 0) return child;
    const std::string pid = "LISTEN_PID=" + std::to_string(::getpid());
    char* const arguments[] = {const_cast<char*>(path.c_str()), nullptr};
    char* const environment[] = {const_cast<char*>(pid.c_str()), const_cast<char*>("LISTEN_FDS=1"),
                                 const_cast<char*>(names.c_str()), const_cast<char*>("LANG=C"), nullptr};
    if (socket.get() == 3 ? ::fcntl(3, F_SETFD, 0) == 0 : ::dup2(socket.get(), 3) == 3)
      ::execve(path.c_str(), arguments, environment);
    ::_exit(1);
  }
  static void reap(pid_t child) {
    int status = -1;
    EXPECT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
  }
};

TEST_F(WorkerServiceTest, AServiceTakesSoManyConnectionsAndOneMoreWhenOneHasHungUp) {
  if (::geteuid() != 0) GTEST_SKIP() << "a worker talks to root only";
  const UniqueFd socket = listen(SOCK_SEQPACKET, 16);
  const pid_t child = startAsService(socket);
  std::vector<WorkerChannel> connections;
  for (std::size_t i = 0; i < WorkerHost::kMaxConnections; ++i) {
    WorkerChannel channel;
    ASSERT_EQ(openOn(connections.emplace_back(connect()), &channel), WorkerResult::done);
    ASSERT_TRUE(echoes(channel));
  }
  WorkerChannel beyond;
  ASSERT_EQ(openOn(connections.emplace_back(connect()), &beyond), WorkerResult::done);
  ASSERT_EQ(beyond.send({.kind = 7, .payload = {}, .descriptors = {}}), WorkerResult::done);
  for (int i = 0; i < 20; ++i) {  // the worker has looked at everything meanwhile
    WorkerChannel channel;
    ASSERT_EQ(openOn(connections[0], &channel), WorkerResult::done);
    ASSERT_TRUE(echoes(channel));
  }
  EXPECT_EQ(beyond.receive(&message, Clock::now()), WorkerResult::timedOut);
  connections[3].close();
  EXPECT_EQ(receive(beyond), WorkerResult::done);
  EXPECT_EQ(message.kind, 7U);
  connections.clear();
  reap(child);
}

TEST_F(WorkerServiceTest, AServiceKeepsNothingOfItsEnvironment) {
  if (::geteuid() != 0) GTEST_SKIP() << "a worker talks to root only";
  const UniqueFd socket = listen(SOCK_SEQPACKET, 16);
  const pid_t child = startAsService(socket);
  WorkerChannel connection = connect();
  WorkerChannel channel;
  ASSERT_EQ(openOn(connection, &channel, WorkForTests::report), WorkerResult::done);
  ASSERT_EQ(receive(channel), WorkerResult::done);
  FieldReader reader(message.payload);
  (void)reader.u64();  // the account and its group
  for (int i = 0; i < 3; ++i) (void)reader.text();
  (void)reader.u32();  // the descriptors
  EXPECT_EQ(reader.u32(), 0U) << "variables";
  EXPECT_FALSE(reader.hasFailed());
  connection.close();
  reap(child);
}

TEST_F(WorkerServiceTest, AServiceHangsUpOnWhoIsNotRoot) {
  if (::geteuid() != 0 || !hasManyAccounts()) GTEST_SKIP() << "needs two accounts";
  const UniqueFd socket = listen(SOCK_SEQPACKET, 16);
  ASSERT_EQ(::chmod(folder.path().c_str(), 0755), 0);
  ASSERT_EQ(::chmod((folder / kService).c_str(), 0777), 0);
  const pid_t child = startAsService(socket);
  WorkerChannel roots = connect();
  ASSERT_EQ(::seteuid(65534), 0);
  WorkerChannel stranger = connect();
  ASSERT_EQ(::seteuid(0), 0);
  WorkerChannel channel;
  (void)openOn(stranger, &channel);  // it may have hung up already
  EXPECT_EQ(receive(channel), WorkerResult::closed);
  ASSERT_EQ(openOn(roots, &channel), WorkerResult::done);
  EXPECT_TRUE(echoes(channel));
  stranger.close();
  roots.close();
  reap(child);
}

TEST_F(WorkerServiceTest, WhoListensAndIsNotRootIsNoWorker) {
  if (::geteuid() != 0 || !hasManyAccounts()) GTEST_SKIP() << "needs two accounts";
  ASSERT_EQ(::chown(folder.path().c_str(), 65534, 65534), 0);
  ASSERT_EQ(::seteuid(65534), 0);
  const UniqueFd socket = listen();
  ASSERT_EQ(::seteuid(0), 0);
  WorkerProgram worker(description());
  WorkerChannel channel;
  EXPECT_EQ(open(worker, WorkForTests::echo, &channel), WorkerResult::unavailable);
  ASSERT_EQ(log.entries().size(), 1U);
  EXPECT_EQ(lines()[0], "cannot connect to " + (folder / kService) + ": Permission denied");
}

TEST_F(WorkerServiceTest, WhereSomebodyListensNoProgramIsStarted) {
  const UniqueFd socket = listen();
  WorkerProgram worker(description({folder / "nowhere"}));
  WorkerChannel channel;
  ASSERT_EQ(open(worker, WorkForTests::echo, &channel), WorkerResult::done);
  EXPECT_EQ(channel.send({.kind = 42, .payload = {}, .descriptors = {}}), WorkerResult::done);

  WorkerChannel connection(UniqueFd(::accept4(socket.get(), nullptr, nullptr, SOCK_CLOEXEC)));
  ASSERT_TRUE(connection.isOpen());
  std::uint32_t work = 0;
  std::thread host([&] {
    WorkerHost::serveConnection(std::move(connection), [&work](std::uint32_t kind, WorkerChannel theirs) {
      work = kind;
      WorkerMessage got;
      (void)theirs.receive(&got, Clock::now() + 20s);
      (void)theirs.send(got);
    });
  });
  EXPECT_EQ(receive(channel), WorkerResult::done);
  EXPECT_EQ(message.kind, 42U);
  worker.giveUp(&channel);  // hangs up
  host.join();
  EXPECT_EQ(work, static_cast<std::uint32_t>(WorkForTests::echo));
  EXPECT_TRUE(children().empty());
}

TEST_F(WorkerServiceTest, WhatAWorkerSendsOverTheMainConnectionKeepsNobodyWaiting) {
  LingeringSocket lingering(2);
  const UniqueFd socket = listen();
  WorkerProgram worker(description());
  WorkerChannel channel;
  ASSERT_EQ(open(worker, WorkForTests::echo, &channel), WorkerResult::done);
  WorkerChannel connection(UniqueFd(::accept4(socket.get(), nullptr, nullptr, SOCK_CLOEXEC)));
  message.descriptors.push_back(std::move(lingering.socket));
  ASSERT_EQ(connection.send(message), WorkerResult::done);
  message.descriptors.clear();  // the last one is on its way now
  const auto before = Clock::now();
  worker.giveUp(&channel);
  EXPECT_LT(Clock::now() - before, 1s);
}

TEST_F(WorkerServiceTest, NobodyIsAskedWhileTooMuchWaitsToBeClosed) {
  std::vector<LingeringSocket> lingering;
  for (int i = 0; i < 10; ++i) lingering.emplace_back(2);
  WorkerProgram worker(description());
  WorkerChannel ours;
  ours.distrust();
  const auto wait = [&](UniqueFd descriptor) {
    message.descriptors.push_back(std::move(descriptor));
    ours.discard(&message);
  };
  for (LingeringSocket& each : lingering) wait(std::move(each.socket));
  for (int i = 0; i < 1000; ++i) wait(UniqueFd(::dup(STDERR_FILENO)));
  WorkerChannel channel;
  EXPECT_EQ(open(worker, WorkForTests::echo, &channel), WorkerResult::unavailable);
  EXPECT_TRUE(children().empty());
  ASSERT_EQ(log.entries().size(), 1U);
  EXPECT_EQ(lines()[0], "worker_for_tests is not asked: too much of what workers sent cannot be closed");
  lingering.clear();  // what has no peer lingers no more
  while (!WorkerChannel::hasRoomToDistrust()) std::this_thread::yield();
  EXPECT_TRUE(works(worker));
}

TEST_F(WorkerServiceTest, ASocketThatNobodyListensBehindIsAsGoodAsNone) {
  listen().reset();
  WorkerProgram worker(description());
  EXPECT_TRUE(works(worker));
}

TEST_F(WorkerServiceTest, AServiceIsNoChildOfThisProcess) {
  WorkerProgram::Description service = description();
  service.isOnlyService = true;
  WorkerProgram worker(service);
  WorkerChannel channel;
  EXPECT_EQ(open(worker, WorkForTests::echo, &channel), WorkerResult::unavailable);
  listen().reset();
  EXPECT_EQ(open(worker, WorkForTests::echo, &channel), WorkerResult::unavailable);
  const std::string beginning = "cannot connect to " + (folder / kService) + ": ";
  EXPECT_EQ(lines(), (std::vector<std::string>{beginning + "No such file or directory",
                                               beginning + "Connection refused"}));
  EXPECT_TRUE(children().empty());
}

TEST_F(WorkerServiceTest, AQueueThatIsFullKeepsNobodyWaiting) {
  const UniqueFd socket = listen();
  WorkerProgram first(description());
  WorkerProgram second(description());
  WorkerProgram third(description());
  WorkerChannel channel;
  EXPECT_EQ(open(first, WorkForTests::echo, &channel), WorkerResult::done);
  EXPECT_EQ(open(second, WorkForTests::echo, &channel), WorkerResult::done);
  EXPECT_EQ(open(third, WorkForTests::echo, &channel), WorkerResult::unavailable);
  ASSERT_EQ(log.entries().size(), 1U);
  EXPECT_EQ(lines()[0], "cannot connect to " + (folder / kService) + ": Resource temporarily unavailable");
}

TEST_F(WorkerServiceTest, AnotherKindOfSocketIsNoWorker) {
  const UniqueFd socket = listen(SOCK_STREAM);
  WorkerProgram worker(description());
  WorkerChannel channel;
  EXPECT_EQ(open(worker, WorkForTests::echo, &channel), WorkerResult::unavailable);
  EXPECT_EQ(log.entries().size(), 1U);
}

TEST(WorkerHostTest, WhatIsNoOpeningOfAChannelIsPassedOver) {
  WorkerChannel ours;
  WorkerChannel theirs;
  ASSERT_EQ(WorkerChannel::makePair(&ours, &theirs), WorkerResult::done);
  WorkerMessage without;
  WorkerMessage noSocket;
  noSocket.descriptors.emplace_back(::open("/dev/null", O_RDWR | O_CLOEXEC));
  WorkerMessage listening;
  listening.descriptors.emplace_back(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  const sockaddr_un unnamed{AF_UNIX, {}};
  const int nobodys = listening.descriptors[0].get();
  ASSERT_EQ(::bind(nobodys, reinterpret_cast<const sockaddr*>(&unnamed), sizeof unnamed.sun_family), 0);
  ASSERT_EQ(::listen(nobodys, 1), 0);
  WorkerMessage stream;
  stream.descriptors.emplace_back(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  WorkerMessage two;
  WorkerMessage good;
  good.kind = 5;
  WorkerChannel ends[6];
  for (int i = 0; i < 6; i += 2)
    ASSERT_EQ(WorkerChannel::makePair(&ends[i], &ends[i + 1]), WorkerResult::done);
  two.descriptors.push_back(ends[0].release());
  two.descriptors.push_back(ends[2].release());
  good.descriptors.push_back(ends[4].release());
  for (const WorkerMessage* each : {&without, &noSocket, &listening, &stream, &two, &good}) {
    ASSERT_EQ(ours.send(*each), WorkerResult::done);
  }
  ours.close();
  std::vector<std::uint32_t> served;
  WorkerHost::serveConnection(std::move(theirs),
                              [&](std::uint32_t work, WorkerChannel) { served.push_back(work); });
  EXPECT_EQ(served, std::vector<std::uint32_t>{5});
}

}  // namespace
}  // namespace brenvik
