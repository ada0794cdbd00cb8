// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// brenvik-store-worker: keeps the voicemail store and the contacts for the helper, with no more rights than
// the account they belong to. Works in the folders that it is handed, and knows no path.
#include <malloc.h>
#include <unistd.h>

#include <atomic>
#include <system_error>
#include <thread>
#include <utility>

#include "platform/log/linux/SystemLog.h"
#include "platform/sqlite/Sqlite.h"
#include "platform/stores/StoreMessages.h"
#include "platform/worker/linux/WorkerHost.h"
#include "workers/stores/StoreService.h"

namespace brenvik {
namespace {

// The helper has one for voicemail and one for each remap under way, of which there is one at a time. Those
// that hang in a file system are what there may be more of.
constexpr int kMaxChannels = 16;
std::atomic<int> channels{0};

void serveOnItsOwnThread(std::uint32_t work, WorkerChannel channel) {
  if (channels.fetch_add(1) >= kMaxChannels) {
    --channels;
    return;
  }
  try {
    std::thread([work, channel = std::move(channel)]() mutable {
      serveStore(work, std::move(channel));
      --channels;
    }).detach();
  } catch (const std::system_error&) {  // no thread: the channel hangs up
    --channels;
  } catch (...) {
    --channels;
    throw;
  }
}

}  // namespace
}  // namespace brenvik

int main() {
  // The same identifier as the helper's: whoever reads its log sees what became of its requests.
  brenvik::SystemLog log("BrenvikMobileHelper");
  brenvik::setLogSink(&log);
  // One heap for all threads: a heap of its own would cost the first request as much as opening its database.
  (void)::mallopt(M_ARENA_MAX, 1);
  // Nothing it is asked goes without: the first request finds the library there.
  (void)brenvik::sqlite();
  const int status = brenvik::WorkerHost::run({.service = brenvik::stores::kService,
                                               .rights = {.accounts = {"mobile"},
                                                          .keptCapabilities = {},
                                                          .isLocalOnly = true,
                                                          .addressSpace = rlim_t{1} << 30}},
                                              brenvik::serveOnItsOwnThread);
  // Work that hangs in somebody's file system must not keep the process.
  ::_exit(status);
}
