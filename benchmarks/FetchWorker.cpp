// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// The network worker of FetchBenchmark: the real one, but that it trusts the authority beside its own file.
#include <limits.h>
#include <unistd.h>

#include <array>
#include <memory>
#include <new>
#include <string>

#include "platform/geo/GeoService.h"
#include "platform/net/linux/SystemEchoNetwork.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/web/linux/curl/CurlWebClient.h"
#include "platform/worker/linux/WorkerHost.h"
#include "workers/network/NetworkServing.h"

namespace brenvik {
namespace {

class NoGeo final : public GeoTickets {
 public:
  std::unique_ptr<ReverseGeocodeTicket> makeReverseGeocodeTicket(Coordinate, IncludeEta, ShiftLocations,
                                                                 const GeoTraits*) override {
    throw std::bad_alloc();
  }
  std::unique_ptr<GeoIpTicket> makeGeoIpTicket(const std::optional<std::string>&) override {
    throw std::bad_alloc();
  }
};

CurlSettings settings() {
  std::array<char, PATH_MAX> path{};
  const auto size = ::readlink("/proc/self/exe", path.data(), path.size() - 1);
  const std::string program(path.data(), static_cast<std::size_t>(size < 0 ? 0 : size));
  CurlSettings made;
  made.certificateAuthorities = program.substr(0, program.rfind('/')) + "/authority.pem";
  made.bodiesForAnotherProcess = true;
  return made;
}

struct Network {
  const CurlSettings curl;
  const std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemQueues queues{*loop};
  const std::unique_ptr<CurlWebClient> web = CurlWebClient::make(queues, curl);
  NoGeo geo{};
  SystemEchoNetwork echo{};
  NetworkServing serving{{queues, *web, geo, echo}};
};

}  // namespace
}  // namespace brenvik

int main() {
  using namespace brenvik;
  const CurlSettings curl = settings();  // the name of its own file cannot be read later
  std::unique_ptr<Network> network;
  ::_exit(WorkerHost::run(
      {.service = "fetch benchmark", .rights = {.accounts = {}, .otherwise = 65534, .keptCapabilities = {}}},
      [&](std::uint32_t work, WorkerChannel channel) {
        if (network == nullptr) network.reset(new Network{curl});
        network->serving.start(work, std::move(channel));
      }));
}
