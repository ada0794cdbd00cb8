// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "workers/callers/CallerService.h"

#include <linux/capability.h>
#include <linux/magic.h>
#include <sys/syscall.h>
#include <sys/vfs.h>

#include <vector>

#include "platform/security/linux/CallerFacts.h"

namespace brenvik {
namespace {

// In any other folder somebody could have put a link named "exe", and would be told where it leads.
bool isOfProc(int folder) noexcept {
  struct statfs facts {};
  return ::fstatfs(folder, &facts) == 0 && facts.f_type == PROC_SUPER_MAGIC;
}

}  // namespace

WorkerRights callerRights() {
  WorkerRights rights;
  rights.otherwise = 65534;
  rights.keptCapabilities = [](gid_t) { return std::vector<int>{CAP_SYS_PTRACE}; };
  rights.isLocalOnly = true;
  // To take connections, questions and answers; to look at folders of /proc; memory; the end.
  rights.onlyCalls = {SYS_recvmsg,        SYS_sendmsg, SYS_accept4,      SYS_getsockopt, SYS_shutdown,
                      SYS_ppoll,          SYS_close,   SYS_statx,        SYS_readlinkat, SYS_fstatfs,
                      SYS_clock_gettime,  SYS_brk,     SYS_mmap,         SYS_munmap,     SYS_mremap,
                      SYS_madvise,        SYS_futex,   SYS_rt_sigreturn, SYS_exit,       SYS_exit_group,
                      SYS_restart_syscall};
#ifdef SYS_poll  // newer architectures have ppoll alone
  rights.onlyCalls.push_back(SYS_poll);
#endif
  rights.descriptors = 128;
  rights.addressSpace = rlim_t{64} << 20;
  return rights;
}

void serveCallers(std::uint32_t work, WorkerChannel channel) {
  if (work != callers::kFacts) return;
  constexpr auto kForEver = std::chrono::steady_clock::time_point::max();
  WorkerMessage question;
  while (channel.receive(&question, kForEver) == WorkerResult::done && callers::isQuestion(question)) {
    const int folder = question.descriptors.front().get();
    if (!isOfProc(folder)) return;
    if (channel.send(callers::encode(callerFactsOf(folder))) != WorkerResult::done) return;
  }
}

}  // namespace brenvik
