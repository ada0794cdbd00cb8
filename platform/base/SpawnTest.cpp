// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/base/Spawn.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <string>

#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

// What the shell's script prints.
std::string outputOf(
    std::string script, void (*prepare)(Spawn&) = [](Spawn&) {}) {
  std::array<int, 2> ends{};
  EXPECT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
  const UniqueFd ours(ends[0]);
  UniqueFd theirs(ends[1]);
  Spawn spawn;
  spawn.give(theirs.get(), STDOUT_FILENO);
  prepare(spawn);
  std::string shell = "sh";
  std::string option = "-c";
  char* const arguments[] = {shell.data(), option.data(), script.data(), nullptr};
  char* const environment[] = {nullptr};
  pid_t pid = -1;
  EXPECT_EQ(spawn.start("/bin/sh", arguments, environment, &pid), 0);
  theirs.reset();
  std::string output;
  std::array<char, 256> piece;
  for (ssize_t size = 0; (size = ::read(ours.get(), piece.data(), piece.size())) > 0;)
    output.append(piece.data(), static_cast<std::size_t>(size));
  EXPECT_EQ(::waitpid(pid, nullptr, 0), pid);
  return output;
}

TEST(SpawnTest, AChildHasNoDescriptorOfOursButTheStandardOnes) {
  const UniqueFd inherited(::fcntl(STDOUT_FILENO, F_DUPFD, 100));  // not close-on-exec
  ASSERT_TRUE(inherited.isValid());
  const std::string number = std::to_string(inherited.get());
  EXPECT_EQ(outputOf("if [ -e /proc/self/fd/" + number + " ]; then echo there; fi"), "");
}

TEST(SpawnTest, WhatAChildWritesWhereItWasGivenNothingIsWrittenNowhere) {
  EXPECT_EQ(outputOf("readlink /proc/self/fd/2; echo lost >&2 && echo written",
                     [](Spawn& spawn) { spawn.giveNothing(STDERR_FILENO); }),
            "/dev/null\nwritten\n");
}

TEST(SpawnTest, SignalsThatWeIgnoreOrBlockEndTheChildAllTheSame) {
  const auto before = std::signal(SIGTERM, SIG_IGN);
  sigset_t blocked;
  sigset_t mask;
  ::sigemptyset(&blocked);
  ::sigaddset(&blocked, SIGTERM);
  ASSERT_EQ(::pthread_sigmask(SIG_BLOCK, &blocked, &mask), 0);
  EXPECT_EQ(outputOf("kill -TERM $$; echo alive"), "");
  (void)::pthread_sigmask(SIG_SETMASK, &mask, nullptr);
  (void)std::signal(SIGTERM, before);
}

TEST(SpawnTest, FolderSessionAndAStreamThatLeadsNowhere) {
  const auto prepare = [](Spawn& spawn) {
    spawn.enterFolder("/");
    spawn.startSession();
    spawn.giveNothing(STDERR_FILENO);
  };
  EXPECT_EQ(
      outputOf("pwd; readlink /proc/self/fd/2; [ $$ = \"$(cut -d' ' -f6 /proc/self/stat)\" ] && echo leads",
               prepare),
      "/\n/dev/null\nleads\n");
}

TEST(SpawnTest, WhatFailsIsSaidAndStartsNothing) {
  char* const none[] = {nullptr};
  pid_t pid = 77;
  EXPECT_EQ(Spawn().start("/no/such/program", none, none, &pid), ENOENT);
  Spawn spawn;
  spawn.give(-1, STDOUT_FILENO);
  EXPECT_EQ(spawn.start("/bin/true", none, none, &pid), EBADF);
  EXPECT_EQ(pid, 77);
}

// 0 under a sanitizer, which looks for leaks itself.
TEST(SpawnTest, WhatWasPreparedIsFreed) {
  const std::size_t before = ::mallinfo2().uordblks;
  for (int i = 0; i < 1000; ++i) Spawn().giveNothing(STDERR_FILENO);
  EXPECT_LT(::mallinfo2().uordblks, before + 10'000);
}

}  // namespace
}  // namespace brenvik
