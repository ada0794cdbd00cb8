// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// The network worker: the only program of the project that opens a socket to the network. It names its Linux
// classes here, and nowhere else.

#include <linux/capability.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <memory>
#include <new>
#include <thread>
#include <vector>

#include "platform/geo/linux/SystemGeoService.h"
#include "platform/log/Log.h"
#include "platform/log/linux/SystemLog.h"
#include "platform/net/linux/SystemEchoNetwork.h"
#include "platform/network/NetworkWork.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/web/linux/curl/CurlWebClient.h"
#include "platform/worker/linux/WorkerHost.h"
#include "workers/network/NetworkServing.h"

namespace brenvik {
namespace {

// Threads, libraries and every body that may be on its way at a time have room in it, and a runaway has not.
constexpr rlim_t kAddressSpace = rlim_t{8} << 30;
// The account "nobody" of every Linux.
constexpr uid_t kNobody = 65534;

// A raw socket where the kernel lets nobody of this group have an echo socket; else nothing.
std::vector<int> capabilitiesFor(gid_t group) {
  std::ifstream file("/proc/sys/net/ipv4/ping_group_range");
  long long first = 1;
  long long last = 0;
  if (file >> first >> last && first <= group && group <= last) return {};
  return {CAP_NET_RAW};
}

// Everything that works, made with the first channel: by then this process has given up its rights.
class Network {
 public:
  Network()
      : loop_(SystemRunLoop::make()),
        queues_(loop_ != nullptr ? *loop_ : throw std::bad_alloc()),
        web_(makeClient(true)),
        // Its answers are read here.
        geocoderWeb_(*BRENVIK_GEOCODER_URL != '\0' ? makeClient(false) : nullptr),
        geo_(queues_, geocoderWeb_ != nullptr ? *geocoderWeb_ : *web_,
             {.geocoderUrl = BRENVIK_GEOCODER_URL,
              .gazetteer = BRENVIK_GAZETTEER,
              .stunServer = BRENVIK_STUN_SERVER}),
        serving_({queues_, *web_, geo_, echo_}) {}

  void start(std::uint32_t work, WorkerChannel channel) noexcept { serving_.start(work, std::move(channel)); }

 private:
  std::unique_ptr<WebClient> makeClient(bool forAnotherProcess) {
    CurlSettings settings;
    settings.bodiesForAnotherProcess = forAnotherProcess;
    auto client = CurlWebClient::make(queues_, std::move(settings));
    if (client == nullptr) throw std::bad_alloc();
    return client;
  }

  const std::unique_ptr<SystemRunLoop> loop_;
  SystemQueues queues_;
  const std::unique_ptr<WebClient> web_;
  const std::unique_ptr<WebClient> geocoderWeb_;
  SystemEchoNetwork echo_;
  SystemGeoService geo_;
  NetworkServing serving_;
};

}  // namespace
}  // namespace brenvik

int main() {
  using namespace brenvik;
  SystemLog log("BrenvikMobileHelper");
  setLogSink(&log);
  std::unique_ptr<Network> network;
  const int status = WorkerHost::run({.service = kNetworkWorkerService,
                                      .rights = {.accounts = {"brenvik-network"},
                                                 .otherwise = kNobody,
                                                 .keptCapabilities = capabilitiesFor,
                                                 .addressSpace = kAddressSpace}},
                                     [&network](std::uint32_t work, WorkerChannel channel) {
                                       if (network == nullptr) network = std::make_unique<Network>();
                                       network->start(work, std::move(channel));
                                     });
  // Not by the destructors: work may be under way on other threads, and nobody waits for it any more.
  ::_exit(status);
}
