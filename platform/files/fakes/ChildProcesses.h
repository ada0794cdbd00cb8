// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <ctime>
#include <fstream>
#include <functional>
#include <string>

namespace brenvik {

// Runs a part of a test in a child process with a mount namespace of its own (and a user namespace, unless
// run by root), so that it can mount file systems nobody else sees and that go away with it. Expectations
// that fail in the child are printed there and fail the test.
inline void inPrivateMounts(const std::function<void()>& body) {
  const uid_t uid = ::geteuid();
  const gid_t gid = ::getegid();
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (::unshare(uid == 0 ? CLONE_NEWNS : CLONE_NEWNS | CLONE_NEWUSER) != 0) ::_exit(2);
    if (uid != 0) {
      std::ofstream("/proc/self/setgroups") << "deny";
      std::ofstream("/proc/self/uid_map") << "0 " << uid << " 1";
      std::ofstream("/proc/self/gid_map") << "0 " << gid << " 1";
    }
    if (::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) ::_exit(3);
    body();
    std::fflush(nullptr);
    ::_exit(testing::Test::HasFailure() ? 1 : 0);
  }
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status)) << "killed by signal " << WTERMSIG(status);
  EXPECT_EQ(WEXITSTATUS(status), 0) << "see above; 2, 3: no namespace or no private mounts to be had";
}

// Mounts an empty tmpfs of `kibibytes` on the directory; only inside inPrivateMounts.
inline void mountSmallDisk(const std::string& directory, int kibibytes) {
  const std::string options = "size=" + std::to_string(kibibytes) + "k";
  ASSERT_EQ(::mount("tmpfs", directory.c_str(), "tmpfs", 0, options.c_str()), 0);
}

// Has the kernel kill the calling process, a forked child of a test, when the time is over.
inline void killThisProcessAfter(std::chrono::microseconds time) {
  sigevent event{};
  event.sigev_notify = SIGEV_SIGNAL;
  event.sigev_signo = SIGKILL;
  timer_t timer{};
  itimerspec when{};
  when.it_value.tv_sec = static_cast<time_t>(time.count() / 1'000'000);
  when.it_value.tv_nsec = static_cast<long>(time.count() % 1'000'000 * 1000);
  if (::timer_create(CLOCK_MONOTONIC, &event, &timer) != 0 ||
      ::timer_settime(timer, 0, &when, nullptr) != 0) {
    ::_exit(99);
  }
}

}  // namespace brenvik
