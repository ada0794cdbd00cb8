// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "workers/callers/CallerService.h"

#include <linux/magic.h>
#include <sys/vfs.h>

#include "platform/security/linux/CallerFacts.h"

namespace brenvik {
namespace {

// In any other folder somebody could have put a link named "exe", and would be told where it leads.
bool isOfProc(int folder) noexcept {
  struct statfs facts {};
  return ::fstatfs(folder, &facts) == 0 && facts.f_type == PROC_SUPER_MAGIC;
}

}  // namespace

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
