// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "workers/callers/CallerService.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <thread>
#include <utility>

#include "platform/security/linux/CallerFacts.h"

namespace brenvik {
namespace {

namespace fs = std::filesystem;

class CallerServiceTest : public testing::Test {
 protected:
  void SetUp() override { serve(callers::kFacts); }
  void TearDown() override {
    channel.close();
    server.join();
    if (!folder.empty()) fs::remove_all(folder);
  }
  void serve(std::uint32_t work) {
    WorkerChannel theirs;
    ASSERT_EQ(WorkerChannel::makePair(&channel, &theirs), WorkerResult::done);
    server =
        std::thread([work, theirs = std::move(theirs)]() mutable { serveCallers(work, std::move(theirs)); });
  }
  static WorkerMessage questionAbout(const std::string& path) {
    WorkerMessage question;
    question.kind = callers::kFacts;
    question.descriptors.emplace_back(::open(path.c_str(), O_PATH | O_CLOEXEC));
    return question;
  }
  WorkerResult ask(const WorkerMessage& question, WorkerMessage* answer) {
    EXPECT_EQ(channel.send(question), WorkerResult::done);
    return channel.receive(answer, std::chrono::steady_clock::now() + std::chrono::seconds(20));
  }
  bool hangsUpOn(const WorkerMessage& question) {
    WorkerMessage answer;
    return ask(question, &answer) == WorkerResult::closed;
  }
  const fs::path& madeFolder() {
    std::string name = (fs::temp_directory_path() / "callers-XXXXXX").string();
    EXPECT_NE(::mkdtemp(name.data()), nullptr);
    return folder = name;
  }

  WorkerChannel channel;
  std::thread server;
  fs::path folder;
};

TEST_F(CallerServiceTest, TellsWhatAProcessExecutesAndItsUserNamespaceAsOftenAsItIsAsked) {
  for (int i = 0; i < 3; ++i) {
    WorkerMessage answer;
    ASSERT_EQ(ask(questionAbout("/proc/" + std::to_string(::getpid())), &answer), WorkerResult::done);
    const auto facts = callers::decode(answer);
    ASSERT_TRUE(facts);
    EXPECT_TRUE(facts->executable);
    EXPECT_EQ(facts->executable, identityAt(AT_FDCWD, "/proc/self/exe"));
    EXPECT_EQ(facts->executablePath, fs::read_symlink("/proc/self/exe"));
    EXPECT_TRUE(facts->userNamespace);
    EXPECT_EQ(facts->userNamespace, identityAt(AT_FDCWD, "/proc/self/ns/user"));
  }
}

TEST_F(CallerServiceTest, KnowsNothingOfAFolderThatIsNoProcesss) {
  WorkerMessage answer;
  ASSERT_EQ(ask(questionAbout("/proc"), &answer), WorkerResult::done);
  const auto facts = callers::decode(answer);
  ASSERT_TRUE(facts);
  EXPECT_FALSE(facts->executable);
  EXPECT_EQ(facts->executablePath, "");
  EXPECT_FALSE(facts->userNamespace);
}

TEST_F(CallerServiceTest, FollowsNoLinkThatSomebodyHasMade) {
  fs::create_symlink("/proc/1/root/etc/hostname", madeFolder() / "exe");
  EXPECT_TRUE(hangsUpOn(questionAbout(folder)));
}

TEST_F(CallerServiceTest, HangsUpOnAQuestionWithoutADescriptor) {
  WorkerMessage question;
  question.kind = callers::kFacts;
  EXPECT_TRUE(hangsUpOn(question));
}

TEST_F(CallerServiceTest, HangsUpOnAQuestionWithTwoDescriptors) {
  WorkerMessage question = questionAbout("/proc/self");
  question.descriptors.emplace_back(::open("/proc/self", O_PATH | O_CLOEXEC));
  EXPECT_TRUE(hangsUpOn(question));
}

TEST_F(CallerServiceTest, HangsUpOnAQuestionWithMoreInIt) {
  WorkerMessage question = questionAbout("/proc/self");
  question.payload.resize(1);
  EXPECT_TRUE(hangsUpOn(question));
}

TEST_F(CallerServiceTest, HangsUpOnAnotherQuestion) {
  WorkerMessage question = questionAbout("/proc/self");
  question.kind = callers::kFacts + 1;
  EXPECT_TRUE(hangsUpOn(question));
}

TEST_F(CallerServiceTest, HangsUpOnAnotherWork) {
  channel.close();
  server.join();
  serve(callers::kFacts + 1);
  WorkerMessage answer;
  EXPECT_EQ(channel.receive(&answer, std::chrono::steady_clock::now() + std::chrono::seconds(20)),
            WorkerResult::closed);
}

#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
// With the rights of the program: 0, or the number of what it can do and should not.
int triesEverything(WorkerChannel theirs) {
  if (giveUpRights(callerRights()) != nullptr) return 1;
  int at = 10;
  const std::string mother = "/proc/" + std::to_string(::getppid());
  for (const std::string& path :
       std::vector<std::string>{"/proc/1/root", "/proc/1/root/etc", mother + "/mem", mother + "/environ",
                                "/proc/self/status", "/etc/hostname", "/dev/null"}) {
    if (::open(path.c_str(), O_RDONLY | O_CLOEXEC) != -1 || errno != EPERM) return at;
    if (::open(path.c_str(), O_PATH | O_CLOEXEC) != -1 || errno != EPERM) return at + 1;
    at += 2;
  }
  for (const long call : {SYS_read,
                          SYS_write,
                          SYS_pread64,
                          SYS_pwrite64,
                          SYS_openat2,
                          SYS_process_vm_readv,
                          SYS_process_vm_writev,
                          SYS_ptrace,
                          SYS_pidfd_open,
                          SYS_pidfd_getfd,
                          SYS_execve,
                          SYS_clone,
                          SYS_kill,
                          SYS_tgkill,
                          SYS_socket,
                          SYS_connect,
                          SYS_unlinkat,
                          SYS_linkat,
                          SYS_symlinkat,
                          SYS_renameat2,
                          SYS_mkdirat,
                          SYS_fchownat,
                          SYS_fchmodat,
                          SYS_ftruncate,
                          SYS_chdir,
                          SYS_getdents64,
                          SYS_memfd_create,
                          SYS_io_uring_setup,
                          SYS_capset}) {
    if (::syscall(call, -1, 0, 0, 0, 0, 0) != -1 || errno != EPERM) return at;
    ++at;
  }
  serveCallers(callers::kFacts, std::move(theirs));
  return 0;
}

TEST(CallerRightsTest, ItAnswersAndIsAbleToDoNothingElse) {
  if (::geteuid() != 0) GTEST_SKIP() << "the program is root's to start";
  WorkerChannel channel;
  WorkerChannel theirs;
  ASSERT_EQ(WorkerChannel::makePair(&channel, &theirs), WorkerResult::done);
  const pid_t child = ::fork();
  if (child == 0) {
    channel.close();
    ::_exit(triesEverything(std::move(theirs)));
  }
  theirs.close();
  WorkerMessage question;
  question.kind = callers::kFacts;
  question.descriptors.emplace_back(::open("/proc/self", O_PATH | O_CLOEXEC));
  for (int i = 0; i < 2; ++i) {
    WorkerMessage answer;
    EXPECT_EQ(channel.send(question), WorkerResult::done);
    EXPECT_EQ(channel.receive(&answer, std::chrono::steady_clock::now() + std::chrono::seconds(20)),
              WorkerResult::done);
    const auto facts = callers::decode(answer);
    ASSERT_TRUE(facts);
    EXPECT_EQ(facts->executable, identityAt(AT_FDCWD, "/proc/self/exe"));
    EXPECT_EQ(facts->executablePath, fs::read_symlink("/proc/self/exe"));
    EXPECT_EQ(facts->userNamespace, identityAt(AT_FDCWD, "/proc/self/ns/user"));
  }
  channel.close();
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}
#endif

}  // namespace
}  // namespace brenvik
