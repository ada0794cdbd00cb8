// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/CallerProcess.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "platform/base/ProcessFacts.h"
#include "platform/security/linux/CallerTestSupport.h"

namespace brenvik {
namespace {

TEST(UnitOfCgroupsTest, TheUnifiedLineGivesItsLastComponent) {
  EXPECT_EQ(unitOfCgroups("0::/system.slice/brenvik.service\n"), "brenvik.service");
  EXPECT_EQ(unitOfCgroups("0::/brenvik.service"), "brenvik.service");
}

TEST(UnitOfCgroupsTest, TheUnifiedLineGoesBeforeTheOneNamedSystemdWhereverItStands) {
  EXPECT_EQ(unitOfCgroups("1:name=systemd:/a.slice/old.service\n0::/a.slice/new.service\n"), "new.service");
  EXPECT_EQ(unitOfCgroups("0::/a.slice/new.service\n1:name=systemd:/a.slice/old.service\n"), "new.service");
  EXPECT_EQ(unitOfCgroups("0::/\n1:name=systemd:/a/old.service\n"), "")
      << "in no unit, says the unified line";
}

TEST(UnitOfCgroupsTest, WithoutAUnifiedLineTheOneNamedSystemdCounts) {
  EXPECT_EQ(unitOfCgroups("2:cpu,cpuacct:/x.slice/wrong.service\n1:name=systemd:/a.slice/old.service\n"),
            "old.service");
}

TEST(UnitOfCgroupsTest, OtherHierarchiesAndOtherTextsGiveNone) {
  EXPECT_EQ(unitOfCgroups(""), "");
  EXPECT_EQ(unitOfCgroups("2:cpu:/x.slice/wrong.service\n"), "");
  EXPECT_EQ(unitOfCgroups("12::/x.slice/wrong.service\n"), "");
  EXPECT_EQ(unitOfCgroups("0:cpu:/x.slice/wrong.service\n"), "");
  EXPECT_EQ(unitOfCgroups("1:name=systemd2:/x.slice/wrong.service\n"), "");
  EXPECT_EQ(unitOfCgroups("1:cpu,name=systemd:/x.slice/wrong.service\n"), "");
  EXPECT_EQ(unitOfCgroups("0::no-slash\n"), "");
  EXPECT_EQ(unitOfCgroups("::\n:\n0\n"), "");
}

TEST(UnitOfCgroupsTest, OnlySlicesOfTheSystemsManagerMayStandAboveAUnit) {
  EXPECT_EQ(unitOfCgroup("/a.slice/a-b.slice/c.scope"), "c.scope");
  EXPECT_EQ(unitOfCgroup("/init.scope"), "init.scope");
  EXPECT_EQ(unitOfCgroup("/user.slice/c.service"), "");
  EXPECT_EQ(unitOfCgroup("/a.slice/user.slice/c.service"), "");
  EXPECT_EQ(unitOfCgroup("/a.service/c.service"), "");
  EXPECT_EQ(unitOfCgroup("/a.scope/b.slice/c.service"), "");
  EXPECT_EQ(unitOfCgroup("/.slice/c.service"), "");
  EXPECT_EQ(unitOfCgroup("/../../c.service"), "");
  EXPECT_EQ(unitOfCgroup("//c.service"), "");
  EXPECT_EQ(unitOfCgroup("/"), "");
  EXPECT_EQ(unitOfCgroup(""), "");
}

TEST(UnitOfCgroupsTest, AColonInThePathBelongsToThePath) {
  EXPECT_EQ(unitOfCgroups("0::/a:b.slice/c:d.service\n"), "c:d.service");
}

TEST(CallerProcessTest, ThisProcessIsFoundWithTheFileItExecutes) {
  const auto startTime = processStartTime(::getpid());
  ASSERT_TRUE(startTime);
  const auto process = CallerProcess::pin("/proc", ::getpid(), *startTime);
  ASSERT_TRUE(process);
  struct stat facts {};
  ASSERT_EQ(::stat("/proc/self/exe", &facts), 0);
  EXPECT_EQ(process->executable(), (FileIdentity{facts.st_dev, facts.st_ino}));
  const CallerFacts known = process->facts();
  EXPECT_EQ(known.executable, process->executable());
  EXPECT_EQ(known.executablePath, std::filesystem::read_symlink("/proc/self/exe"));
  EXPECT_TRUE(known.userNamespace);
  EXPECT_EQ(known.userNamespace, CallerProcess::namespaceOfThisProcess("/proc"));
}

TEST(CallerProcessTest, AProcessThatStartedAtAnotherTimeIsNotTheOneWanted) {
  const auto startTime = processStartTime(::getpid());
  ASSERT_TRUE(startTime);
  EXPECT_FALSE(CallerProcess::pin("/proc", ::getpid(), *startTime + 1));
}

TEST(CallerProcessTest, NoProcessHasTheIdZeroOrANegativeOne) {
  EXPECT_FALSE(CallerProcess::pin("/proc", 0, 0));
  EXPECT_FALSE(CallerProcess::pin("/proc", -1, 0));
}

TEST(CallerProcessTest, AProcessThatExitedRunsNoLongerWhetherItsParentKnowsOrNot) {
  const pid_t child = ::fork();
  if (child == 0) {
    ::pause();
    ::_exit(0);
  }
  ASSERT_GT(child, 0);
  const auto startTime = processStartTime(child);
  ASSERT_TRUE(startTime);
  const auto process = CallerProcess::pin("/proc", child, *startTime);
  ASSERT_TRUE(process);
  EXPECT_TRUE(process->executable());

  ::kill(child, SIGKILL);
  siginfo_t exited;
  ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(child), &exited, WEXITED | WNOWAIT), 0);
  EXPECT_FALSE(process->executable()) << "it awaits its parent";
  EXPECT_FALSE(CallerProcess::pin("/proc", child, *startTime));

  ASSERT_EQ(::waitpid(child, nullptr, 0), child);
  EXPECT_FALSE(process->executable()) << "it is gone";
  EXPECT_EQ(process->facts().executablePath, "");
  EXPECT_FALSE(process->facts().userNamespace);
  EXPECT_EQ(process->unit(), "");
}

// A made-up /proc with the process 7, for what a real one is seldom caught at.
class MadeUpProcessFolderTest : public testing::Test {
 protected:
  void SetUp() override {
    std::string name = (std::filesystem::temp_directory_path() / "caller-XXXXXX").string();
    ASSERT_NE(::mkdtemp(name.data()), nullptr);
    proc = name;
    std::filesystem::create_directory(proc / "7");
    writeStat('S', "100");
  }
  void TearDown() override { std::filesystem::remove_all(proc); }

  void write(const char* name, const std::string& content) {
    std::ofstream(proc / "7" / name, std::ios::binary) << content;
  }
  void writeStat(char state, const char* startTime) {
    write("stat", std::string("7 (caller) ") + state + " 1 7 7 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 " + startTime +
                      " 0\n");
  }
  bool isThere() { return CallerProcess::pin(proc.string(), 7, 100).has_value(); }

  std::filesystem::path proc;
};

TEST_F(MadeUpProcessFolderTest, AProcessThatIsBeingRemovedIsThereNoLonger) {
  EXPECT_TRUE(isThere());
  for (const char gone : {'Z', 'X'}) {
    writeStat(gone, "100");
    EXPECT_FALSE(isThere()) << gone;
  }
}

TEST_F(MadeUpProcessFolderTest, TheFirstProcessIsOneLikeAnyOther) {
  std::filesystem::rename(proc / "7", proc / "1");
  EXPECT_TRUE(CallerProcess::pin(proc.string(), 1, 100));
}

TEST_F(MadeUpProcessFolderTest, FactsThatAreEmptyOrCutShortOrNoneAreNobodys) {
  for (const char* const text : {"", "7 (caller) S 1 7", "nonsense"}) {
    write("stat", text);
    EXPECT_FALSE(isThere()) << text;
  }
  std::filesystem::remove(proc / "7/stat");
  EXPECT_FALSE(isThere());
}

TEST_F(MadeUpProcessFolderTest, AListOfGroupsThatCannotBeReadOrNeverEndsGivesNoUnit) {
  const std::string line = "0::/system.slice/caller.service\n";
  const auto process = CallerProcess::pin(proc.string(), 7, 100);
  ASSERT_TRUE(process);
  EXPECT_EQ(process->unit(), "") << "no file";
  write("cgroup", line);
  EXPECT_EQ(process->unit(), "caller.service");
  constexpr std::size_t kLargest = 64 << 10;
  write("cgroup", std::string(kLargest - line.size(), '\n') + line);
  EXPECT_EQ(process->unit(), "caller.service") << "long, but no longer than it may be";
  write("cgroup", std::string(kLargest - line.size() + 1, '\n') + line);
  EXPECT_EQ(process->unit(), "");
}

TEST_F(MadeUpProcessFolderTest, TheReaderIsAskedWhenEitherOfTheTwoFactsMayNotBeRead) {
  std::filesystem::create_directories(proc / "7/ns");
  std::filesystem::create_directory(proc / "closed");
  ASSERT_EQ(::chmod((proc / "closed").c_str(), 0), 0);
  const auto asked = [&](const char* executable, const char* userNamespace) {
    std::filesystem::remove(proc / "7/exe");
    std::filesystem::remove(proc / "7/ns/user");
    std::filesystem::create_symlink(proc / executable, proc / "7/exe");
    std::filesystem::create_symlink(proc / userNamespace, proc / "7/ns/user");
    return withoutCapabilities([&] {
      AnsweringReader reader;
      const auto process = CallerProcess::pin(proc.string(), 7, 100, &reader);
      if (!process) return 90;
      const CallerFacts facts = process->facts();
      if (!facts.executable || !facts.userNamespace) return 91;
      const bool isTheReaders = facts.executable == someFacts().executable &&
                                facts.userNamespace == someFacts().userNamespace &&
                                facts.executablePath == someFacts().executablePath;
      return isTheReaders == (reader.asked > 0) ? reader.asked : 92;
    });
  };
  EXPECT_EQ(asked("7/stat", "7/stat"), 0);
  EXPECT_EQ(asked("closed/x", "7/stat"), 1);
  EXPECT_EQ(asked("7/stat", "closed/x"), 1);
  EXPECT_EQ(asked("closed/x", "closed/x"), 1);
  ASSERT_EQ(::chmod((proc / "closed").c_str(), 0700), 0);  // so that it can be removed
}

TEST_F(MadeUpProcessFolderTest, ThePathOfTheExecutableIsWhatTheKernelSaysHoweverShort) {
  std::filesystem::create_symlink("x", proc / "7/exe");
  const auto process = CallerProcess::pin(proc.string(), 7, 100);
  ASSERT_TRUE(process);
  EXPECT_EQ(process->facts().executablePath, "x");
}

TEST_F(MadeUpProcessFolderTest, NoProgramThatIsStartedMeanwhileGetsAProcesssFolder) {
  const auto inherited = [] {
    int count = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
      const int flags = ::fcntl(std::stoi(entry.path().filename()), F_GETFD);
      if (flags >= 0 && (flags & FD_CLOEXEC) == 0) ++count;
    }
    return count;
  };
  const int before = inherited();
  const auto process = CallerProcess::pin(proc.string(), 7, 100);
  ASSERT_TRUE(process);
  EXPECT_EQ(inherited(), before);
}

}  // namespace
}  // namespace brenvik
