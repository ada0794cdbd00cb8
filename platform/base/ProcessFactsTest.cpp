// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/ProcessFacts.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <thread>

#include <string>

namespace brenvik {
namespace {

std::string statText(const std::string& name, const std::string& startTime) {
  return "7 (" + name + ") S 1 7 7 0 -1 4194304 100 0 0 0 0 0 0 0 20 0 1 0 " + startTime + " 1000 200\n";
}

TEST(ProcessStatTest, StateAndStartTimeAreFoundInAUsualLine) {
  const auto facts = parseProcessStat(statText("cat", "12345"));
  ASSERT_TRUE(facts);
  EXPECT_EQ(facts->state, 'S');
  EXPECT_EQ(facts->session, 7);
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

TEST(ProcessFactsTest, TellsOfThisProcess) {
  const auto facts = processFacts(::getpid());
  ASSERT_TRUE(facts);
  EXPECT_EQ(facts->state, 'R');
  EXPECT_EQ(facts->session, ::getsid(0));
  EXPECT_EQ(processStartTime(::getpid()), facts->startTime);
}

TEST(ProcessFactsTest, TellsNothingOfNobody) {
  EXPECT_FALSE(processFacts(0x7FFFFFFF));
  EXPECT_FALSE(processStartTime(-1));
}

// A program of our own that runs until it is told to end.
class ProgramFactsTest : public testing::Test {
 protected:
  ProgramFactsTest() {
    std::string name = (std::filesystem::temp_directory_path() / "program-XXXXXX").string();
    folder_ = ::mkdtemp(name.data());
    program = folder_ / "sleep";
    std::filesystem::copy_file("/bin/sleep", program);
    process_ = ::fork();
    if (process_ == 0) {
      ::execl(program.c_str(), "sleep", "60", nullptr);
      ::_exit(127);
    }
    link = "/proc/" + std::to_string(process_) + "/exe";
    while (std::filesystem::read_symlink(link) != program) std::this_thread::yield();
  }
  ~ProgramFactsTest() override {
    ::kill(process_, SIGKILL);
    ::waitpid(process_, nullptr, 0);
    std::filesystem::remove_all(folder_);
  }
  std::filesystem::path program;
  std::string link;

 private:
  std::filesystem::path folder_;
  pid_t process_ = -1;
};

TEST_F(ProgramFactsTest, AProgramThatStandsWhereItStoodIsNotReplaced) {
  const ProgramFacts facts = programFactsOf(link.c_str());
  EXPECT_EQ(facts.path, program.string());
  EXPECT_FALSE(facts.isReplaced);
}

TEST_F(ProgramFactsTest, AnotherFileInItsPlaceIsNoticedAndThePathStays) {
  std::filesystem::copy_file("/bin/sleep", program.string() + ".new");
  std::filesystem::rename(program.string() + ".new", program);
  const ProgramFacts facts = programFactsOf(link.c_str());
  EXPECT_EQ(facts.path, program.string());
  EXPECT_TRUE(facts.isReplaced);
}

TEST_F(ProgramFactsTest, AProgramThatWasRemovedIsReplacedToo) {
  std::filesystem::remove(program);
  const ProgramFacts facts = programFactsOf(link.c_str());
  EXPECT_EQ(facts.path, program.string());
  EXPECT_TRUE(facts.isReplaced);
}

TEST(ProgramFactsOfNobodyTest, NothingIsKnown) {
  const ProgramFacts facts = programFactsOf("/proc/0/exe");
  EXPECT_EQ(facts.path, "");
  EXPECT_FALSE(facts.isReplaced);
  EXPECT_EQ(programFacts().path, std::filesystem::read_symlink("/proc/self/exe").string());
}

}  // namespace
}  // namespace brenvik
