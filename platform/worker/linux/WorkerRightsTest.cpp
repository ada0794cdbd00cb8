// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/worker/linux/WorkerRights.h"

#include <grp.h>
#include <gtest/gtest.h>
#include <linux/capability.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdint>
#include <fstream>
#include <functional>
#include <string>
#include <string_view>

namespace brenvik {
namespace {

constexpr uid_t kNobody = 65534;

// Not in a user namespace that knows one only.
bool hasManyAccounts() {
  std::ifstream map("/proc/self/uid_map");
  std::uint64_t inside = 0;
  std::uint64_t outside = 0;
  std::uint64_t count = 0;
  return static_cast<bool>(map >> inside >> outside >> count) && inside == 0 && count > kNobody;
}
bool canBecomeNobody() { return ::geteuid() == 0 && hasManyAccounts(); }

// What a process of its own says, whose rights are gone with it: 0 from `body`, or the number of a check.
int inProcess(const std::function<int()>& body) {
  const pid_t child = ::fork();
  if (child == 0) ::_exit(body());
  int status = -1;
  EXPECT_EQ(::waitpid(child, &status, 0), child);
  return WIFSIGNALED(status) ? -WTERMSIG(status) : WEXITSTATUS(status);
}

bool says(const char* why, std::string_view expected) { return why != nullptr && why == expected; }

WorkerRights ofNobody() {
  WorkerRights rights;
  rights.otherwise = kNobody;
  return rights;
}

bool isLimit(__rlimit_resource what, rlim_t value) {
  rlimit limit{};
  return ::getrlimit(what, &limit) == 0 && limit.rlim_cur == value && limit.rlim_max == value;
}

// Of the permitted and the effective ones.
bool hasCapabilities(std::uint32_t bits) {
  __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct data[_LINUX_CAPABILITY_U32S_3] = {};
  return ::syscall(SYS_capget, &header, data) == 0 && data[0].permitted == bits &&
         data[0].effective == bits && data[0].inheritable == 0 && data[1].permitted == 0;
}

TEST(WorkerRightsTest, RootIsNobodysOtherAccount) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root becomes another account";
  EXPECT_EQ(inProcess([] {
              WorkerRights rights;
              if (!says(giveUpRights(rights), "the account does not exist")) return 1;
              rights.otherwise = 0;
              if (!says(giveUpRights(rights), "the account is root's")) return 2;
              rights.otherwise = kNobody;
              rights.accounts = {"no-such-account", "root"};
              return says(giveUpRights(rights), "the account is root's") ? 0 : 3;
            }),
            0);
}

TEST(WorkerRightsTest, OfRootNothingStays) {
  if (!canBecomeNobody()) GTEST_SKIP() << "only root becomes another account";
  EXPECT_EQ(inProcess([] {
              const gid_t groups[] = {0, 4711};
              if (::setgroups(2, groups) != 0) return 1;
              if (giveUpRights(ofNobody()) != nullptr) return 2;
              if (::getuid() != kNobody || ::geteuid() != kNobody || ::getegid() != kNobody) return 3;
              if (::getgroups(0, nullptr) != 0) return 4;
              if (!hasCapabilities(0)) return 5;
              return ::setuid(0) != 0 && ::setgid(0) != 0 && ::setgroups(2, groups) != 0 ? 0 : 6;
            }),
            0);
}

TEST(WorkerRightsTest, OfTheCapabilitiesThoseThatWereNamedStay) {
  if (!canBecomeNobody()) GTEST_SKIP() << "only root becomes another account";
  EXPECT_EQ(inProcess([] {
              WorkerRights rights = ofNobody();
              gid_t group = 0;
              rights.keptCapabilities = [&group](gid_t asked) {
                group = asked;
                return std::vector<int>{CAP_NET_RAW};
              };
              if (giveUpRights(rights) != nullptr) return 1;
              if (group != kNobody) return 2;
              return hasCapabilities(1U << CAP_NET_RAW) && ::setuid(0) != 0 ? 0 : 3;
            }),
            0);
}

TEST(WorkerRightsTest, NobodyLooksIntoItAndItsLimitsHold) {
  const int failed = inProcess([] {
    // As the service manager starts it.
    if (canBecomeNobody() && ::setresuid(kNobody, kNobody, kNobody) != 0) return 1;
    if (::prctl(PR_SET_DUMPABLE, 1, 0, 0, 0) != 0) return 2;
    WorkerRights rights = ofNobody();
    rights.descriptors = 99;
    rights.addressSpace = rlim_t{1} << 40;
    if (giveUpRights(rights) != nullptr) return 3;
    if (::prctl(PR_GET_DUMPABLE, 0, 0, 0, 0) != 0) return 4;
    if (::prctl(PR_GET_NO_NEW_PRIVS, 0, 0, 0, 0) != 1) return 5;
    if (!isLimit(RLIMIT_CORE, 0) || !isLimit(RLIMIT_NOFILE, 99)) return 6;
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
    if (!isLimit(RLIMIT_AS, rights.addressSpace)) return 7;
#endif
    return 0;
  });
  EXPECT_EQ(failed, 0);
}

#if defined(__x86_64__) || defined(__aarch64__)
const char* becomeLocal() {
  WorkerRights rights = ofNobody();
  rights.isLocalOnly = true;
  return giveUpRights(rights);
}

TEST(WorkerRightsTest, ALocalWorkerStartsNoProgramAndLooksIntoNoProcess) {
  EXPECT_EQ(inProcess([] {
              if (becomeLocal() != nullptr) return 1;
              int at = 10;
              for (const long call : {SYS_execve, SYS_execveat, SYS_ptrace, SYS_process_vm_readv,
                                      SYS_process_vm_writev, SYS_io_uring_setup, SYS_pidfd_getfd, SYS_bpf,
                                      SYS_userfaultfd, SYS_mount, SYS_unshare, SYS_setns}) {
                // Without the filter each of them says something else about such arguments.
                if (::syscall(call, 0, -1, -1, -1, 0, 0) != -1 || errno != EPERM) return at;
                ++at;
              }
              return 0;
            }),
            0);
}

#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
TEST(WorkerRightsTest, AWorkerThatNamesItsCallsMayMakeNoOther) {
  EXPECT_EQ(inProcess([] {
              WorkerRights rights = ofNobody();
              rights.isLocalOnly = true;
              rights.onlyCalls = {SYS_getpid, SYS_exit_group};
              if (giveUpRights(rights) != nullptr) return 1;
              if (::syscall(SYS_getpid) <= 0) return 2;
              int at = 10;
              for (const long call : {SYS_openat, SYS_openat2, SYS_read, SYS_write, SYS_getppid, SYS_socket,
                                      SYS_prctl, SYS_seccomp, SYS_execve, SYS_kill}) {
                if (::syscall(call, 0, 0, 0, 0, 0, 0) != -1 || errno != EPERM) return at;
                ++at;
              }
              return 0;
            }),
            0);
}
#endif
#endif

#if defined(__x86_64__)
TEST(WorkerRightsTest, NoOtherNumberingOfTheCallsLeadsPastTheFilter) {
  constexpr long kOtherTable = 0x40000000;
  EXPECT_EQ(inProcess([] {
              if (becomeLocal() != nullptr) return 1;
              return ::syscall(kOtherTable | SYS_getpid) == -1 && errno == EPERM ? 0 : 2;
            }),
            0);
  const auto askAsOldPrograms = [] {
    int result = 20;  // their getpid
    asm volatile("int $0x80" : "+a"(result) : : "memory", "r8", "r9", "r10", "r11");
    return result > 0 ? 0 : 1;
  };
  if (inProcess(askAsOldPrograms) != 0) GTEST_SKIP() << "this kernel has no calls of 32 bits";
  EXPECT_EQ(inProcess([&] { return becomeLocal() != nullptr ? 1 : askAsOldPrograms(); }), -SIGSYS);
}
#endif

}  // namespace
}  // namespace brenvik
