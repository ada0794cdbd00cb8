// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/CallerProcess.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>

#include "platform/base/ProcessStartTime.h"

namespace brenvik {
namespace {

std::string statText(const std::string& name, const std::string& startTime) {
  return "7 (" + name + ") S 1 7 7 0 -1 4194304 100 0 0 0 0 0 0 0 20 0 1 0 " + startTime + " 1000 200\n";
}

TEST(ProcessStatTest, StateAndStartTimeAreFoundInAUsualLine) {
  const auto facts = parseProcessStat(statText("cat", "12345"));
  ASSERT_TRUE(facts);
  EXPECT_EQ(facts->state, 'S');
  EXPECT_EQ(facts->startTime, 12345U);
}

TEST(ProcessStatTest, ANameThatImitatesFieldsChangesNothing) {
  const auto facts = parseProcessStat(statText("a) Z 1 1 1 0 -1 (", "12345"));
  ASSERT_TRUE(facts);
  EXPECT_EQ(facts->state, 'S');
  EXPECT_EQ(facts->startTime, 12345U);
}

TEST(ProcessStatTest, OfALongStartTimeTheLow32BitsCount) {
  const auto facts = parseProcessStat(statText("cat", "4294967298"));
  ASSERT_TRUE(facts);
  EXPECT_EQ(facts->startTime, 2U);
}

TEST(ProcessStatTest, ALineCutShortAnywhereBeforeTheStartTimeIsRefused) {
  const std::string line = statText("cat", "12345");
  const std::size_t startTime = line.find("12345");
  for (std::size_t size = 0; size < startTime; ++size) {
    EXPECT_FALSE(parseProcessStat(line.substr(0, size))) << size;
  }
  EXPECT_FALSE(parseProcessStat(statText("cat", "x")));
}

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
  EXPECT_TRUE(process->isStillRunning());
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
  EXPECT_TRUE(process->isStillRunning());

  ::kill(child, SIGKILL);
  siginfo_t exited;
  ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(child), &exited, WEXITED | WNOWAIT), 0);
  EXPECT_FALSE(process->isStillRunning()) << "it awaits its parent";
  EXPECT_FALSE(CallerProcess::pin("/proc", child, *startTime));

  ASSERT_EQ(::waitpid(child, nullptr, 0), child);
  EXPECT_FALSE(process->isStillRunning()) << "it is gone";
  EXPECT_FALSE(process->executable());
  EXPECT_FALSE(process->openExecutable().isValid());
  EXPECT_EQ(process->unit(), "");
}

}  // namespace
}  // namespace brenvik
