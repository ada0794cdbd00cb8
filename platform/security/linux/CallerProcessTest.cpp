// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/CallerProcess.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>

#include "platform/base/ProcessFacts.h"

namespace brenvik {
namespace {

TEST(UnitOfCgroupsTest, TheUnifiedLineGivesItsLastComponent) {
  EXPECT_EQ(unitOfCgroups("0::/system.slice/brenvik.service\n"), "brenvik.service");
  EXPECT_EQ(unitOfCgroups("0::/brenvik.service"), "brenvik.service");
}

TEST(UnitOfCgroupsTest, TheUnifiedLineGoesBeforeTheOneNamedSystemdWhereverItStands) {
  EXPECT_EQ(unitOfCgroups("1:name=systemd:/a/old.service\n0::/a/new.service\n"), "new.service");
  EXPECT_EQ(unitOfCgroups("0::/a/new.service\n1:name=systemd:/a/old.service\n"), "new.service");
  EXPECT_EQ(unitOfCgroups("0::/\n1:name=systemd:/a/old.service\n"), "")
      << "in no unit, says the unified line";
}

TEST(UnitOfCgroupsTest, WithoutAUnifiedLineTheOneNamedSystemdCounts) {
  EXPECT_EQ(unitOfCgroups("2:cpu,cpuacct:/x/wrong.service\n1:name=systemd:/a/old.service\n"), "old.service");
}

TEST(UnitOfCgroupsTest, OtherHierarchiesAndOtherTextsGiveNone) {
  EXPECT_EQ(unitOfCgroups(""), "");
  EXPECT_EQ(unitOfCgroups("2:cpu:/x/wrong.service\n"), "");
  EXPECT_EQ(unitOfCgroups("12::/x/wrong.service\n"), "");
  EXPECT_EQ(unitOfCgroups("0:cpu:/x/wrong.service\n"), "");
  EXPECT_EQ(unitOfCgroups("0::no-slash\n"), "");
  EXPECT_EQ(unitOfCgroups("::\n:\n0\n"), "");
}

TEST(UnitOfCgroupsTest, AColonInThePathBelongsToThePath) {
  EXPECT_EQ(unitOfCgroups("0::/a:b/c:d.service\n"), "c:d.service");
}

TEST(CallerProcessTest, ThisProcessIsFoundWithTheFileItExecutes) {
  const auto startTime = processStartTime(::getpid());
  ASSERT_TRUE(startTime);
  const auto process = CallerProcess::pin("/proc", ::getpid(), *startTime);
  ASSERT_TRUE(process);
  struct stat facts {};
  ASSERT_EQ(::stat("/proc/self/exe", &facts), 0);
  EXPECT_EQ(process->executable(), (CallerProcess::FileIdentity{facts.st_dev, facts.st_ino}));
  EXPECT_TRUE(process->openExecutable().isValid());
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
  EXPECT_FALSE(process->openExecutable().isValid());
  EXPECT_EQ(process->unit(), "");
}

}  // namespace
}  // namespace brenvik
