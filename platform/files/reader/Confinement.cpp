// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "Confinement.h"

#include <fcntl.h>
#include <grp.h>
#include <linux/capability.h>
#include <seccomp.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>

namespace brenvik {
namespace {

constexpr rlim_t kAddressSpace = rlim_t{96} << 20;  // the libraries take two thirds of it
constexpr rlim_t kProcessorSeconds = 30;            // 1 GiB is inflated in a fifth of that
constexpr id_t kNobody = 65534;

bool limit(__rlimit_resource what, rlim_t value) {
  const rlimit both{value, value};
  return ::setrlimit(what, &both) == 0;
}

// A process of root's has root's capabilities again after exec(2), however it was started.
bool dropCapabilities() {
  __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
  const __user_cap_data_struct none[_LINUX_CAPABILITY_U32S_3] = {};
  return ::syscall(SYS_capset, &header, none) == 0;
}

volatile std::sig_atomic_t isConfined = 0;

// libseccomp loops for ever when it runs out of memory in the wrong place. Nothing has been read then, and
// the helper waits: the process leaves after a quarter of a second, of which it needs a hundredth.
bool limitTimeOfConfining() {
  struct sigaction action {};
  action.sa_handler = [](int) {
    if (isConfined == 0) ::_exit(1);
  };
  action.sa_flags = SA_RESTART;
  const itimerval once{{0, 0}, {0, 250'000}};  // processor time: a busy machine does not count
  return ::sigaction(SIGPROF, &action, nullptr) == 0 && ::setitimer(ITIMER_PROF, &once, nullptr) == 0;
}

bool filterSystemCalls() {
  constexpr std::array kAllowed{
      SCMP_SYS(read),         SCMP_SYS(write),     SCMP_SYS(writev),        SCMP_SYS(lseek),
      SCMP_SYS(fstat),        SCMP_SYS(brk),       SCMP_SYS(mmap),          SCMP_SYS(munmap),
      SCMP_SYS(mremap),       SCMP_SYS(close),     SCMP_SYS(futex),         SCMP_SYS(fcntl),
      SCMP_SYS(fadvise64),    SCMP_SYS(getrandom), SCMP_SYS(clock_gettime), SCMP_SYS(madvise),
      SCMP_SYS(rt_sigreturn), SCMP_SYS(exit),      SCMP_SYS(exit_group),    SCMP_SYS(vmsplice)};
  scmp_filter_ctx filter = ::seccomp_init(SCMP_ACT_KILL_PROCESS);
  if (filter == nullptr) return false;
  bool good = true;
  for (const int call : kAllowed) good = good && ::seccomp_rule_add(filter, SCMP_ACT_ALLOW, call, 0) == 0;
  // fstat(2) of newer C libraries; only ever of an open descriptor.
  const scmp_arg_cmp emptyPath{3, SCMP_CMP_MASKED_EQ, AT_EMPTY_PATH, AT_EMPTY_PATH};
  good = good && ::seccomp_rule_add_array(filter, SCMP_ACT_ALLOW, SCMP_SYS(newfstatat), 1, &emptyPath) == 0;
  // The one that is refused instead of ending the process: it shows that the filter is in force.
  good = good && ::seccomp_rule_add(filter, SCMP_ACT_ERRNO(EUCLEAN), SCMP_SYS(getppid), 0) == 0;
  good = good && ::seccomp_load(filter) == 0;
  ::seccomp_release(filter);
  return good;
}

}  // namespace

bool confineThisProcess() {
  // Only root can. Under the service unit it may not, and in a user namespace there may be no other user to
  // become: then it stays as it is, without a capability and behind the filter.
  const bool isNobody = ::setgroups(0, nullptr) == 0 && ::setresgid(kNobody, kNobody, kNobody) == 0 &&
                        ::setresuid(kNobody, kNobody, kNobody) == 0;
  (void)isNobody;
  if (!dropCapabilities() || !limit(RLIMIT_CORE, 0) || !limit(RLIMIT_FSIZE, 0) ||
      !limit(RLIMIT_CPU, kProcessorSeconds) || !limit(RLIMIT_AS, kAddressSpace) ||
      ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) {
    return false;
  }
  if (!limitTimeOfConfining() || !filterSystemCalls()) return false;
  isConfined = 1;
  errno = 0;
  return ::syscall(SYS_getppid) == -1 && errno == EUCLEAN;
}

}  // namespace brenvik
