// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// brenvik-caller-worker: tells the helper which programs its callers run. It has the capability that this
// takes, and is able to do nothing else with it: it opens no file.
#include <linux/capability.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "platform/log/linux/SystemLog.h"
#include "platform/security/linux/CallerFacts.h"
#include "platform/worker/linux/WorkerHost.h"
#include "workers/callers/CallerService.h"

namespace brenvik {
namespace {

// To take connections, questions and answers; to look at folders of /proc; memory; the end.
const std::vector<std::uint32_t> kCalls{
    SYS_recvmsg, SYS_sendmsg,    SYS_accept4,         SYS_getsockopt, SYS_shutdown,      SYS_ppoll,
    SYS_close,   SYS_statx,      SYS_readlinkat,      SYS_fstatfs,    SYS_clock_gettime, SYS_brk,
    SYS_mmap,    SYS_munmap,     SYS_mremap,          SYS_madvise,    SYS_futex,         SYS_rt_sigreturn,
    SYS_exit,    SYS_exit_group, SYS_restart_syscall,
#ifdef SYS_poll  // newer architectures have ppoll alone
    SYS_poll,
#endif
};

}  // namespace
}  // namespace brenvik

int main() {
  // The same identifier as the helper's: whoever reads its log sees what became of its callers.
  brenvik::SystemLog log("BrenvikMobileHelper");
  brenvik::setLogSink(&log);
  const int status = brenvik::WorkerHost::run(
      {.service = brenvik::callers::kService,
       .rights = {.accounts = {},
                  .otherwise = 65534,
                  .keptCapabilities = [](gid_t) { return std::vector<int>{CAP_SYS_PTRACE}; },
                  .isLocalOnly = true,
                  .onlyCalls = brenvik::kCalls,
                  .descriptors = 32,
                  .addressSpace = rlim_t{64} << 20}},
      brenvik::serveCallers);
  ::_exit(status);
}
