// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/core/Composition.h"

#include <new>
#include <utility>

#include "helper/carrier/CarrierOperations.h"
#include "helper/carrier/FileSystemManager.h"
#include "helper/carrier/PathPolicy.h"
#include "helper/core/HelperStatus.h"
#include "helper/core/StatusLine.h"
#include "helper/requests/RequestTable.h"

namespace brenvik {
namespace {

// What serves the requests: the areas, and the platform below them that only requests need.
class Serving {
 public:
  Serving(const HelperPlatform& platform, const HelperState& state)
      : queues_(platform.queues),
        regions_(platform.regions),
        state_(state),
        mobile_(state.mobile()),
        platform_(platform.makeRequestPlatform(mobile_)) {
    state_.lasd.configure({.queues = queues_,
                           .web = roles_.web,
                           .gunzip = roles_.gunzip,
                           .preferences = roles_.preferences,
                           .messagePorts = roles_.messagePorts,
                           .now = platform.now});
    state_.heartbeat.configure({.queues = queues_, .network = roles_.echoNetwork});
  }
  Serving(const Serving&) = delete;
  Serving& operator=(const Serving&) = delete;

  RequestAreas& areas() noexcept { return areas_; }
  std::vector<StatusReport::Worker> workers() const { return platform_->workers(); }

  // Ends the work of other threads.
  void shutDown() noexcept {
    platform_->shutDown();
    state_.lasd.shutDown();
    state_.heartbeat.shutDown();
  }

 private:
  MobileAccount account() const { return {mobile_.homeDirectory(), mobile_.uid(), mobile_.gid()}; }

  WorkQueues& queues_;
  RegionAllocator& regions_;
  const HelperState& state_;
  MobileUser& mobile_;
  const std::unique_ptr<RequestPlatform> platform_;
  const RequestPlatform::Roles roles_ = platform_->roles();

  PreferenceTransfer preferenceTransfer_{roles_.preferences, regions_, [this](const char* path) {
                                           return FileSystemManager(roles_.files).readDictionary(path);
                                         }};
  PathPolicy policy_{[this] { return account(); }};
  CarrierOperations carrier_{FileSystemManager::factory(roles_.files), roles_.archives, policy_,
                             roles_.preferences, [this] { return account(); }};
  RadioLogging radioLogging_{roles_.radio};
  LabelRoutines labels_{roles_.labeler, regions_};
  ChannelRemap channelRemap_{roles_.contacts};
  VoicemailOperations voicemail_{roles_.voicemail, roles_.visualVoicemail};
  LocationRoutines location_{queues_, roles_.geo, roles_.telephony, state_.location};

  RequestAreas areas_{state_.registry, preferenceTransfer_, carrier_, voicemail_,
                      location_,       radioLogging_,       labels_,  channelRemap_,
                      state_.lasd,     state_.heartbeat};
};

// What the process tells about itself: at its status socket, and to the service manager in one line. Both
// come after the first reply, for which somebody waits.
class Telling {
 public:
  // Processes that work for this one, and whether each runs at this moment; main loop only.
  using Workers = std::function<std::vector<StatusReport::Worker>()>;

  Telling(const HelperPlatform& platform, const HelperState& state, Workers workers)
      : platform_(platform), state_(state), workers_(std::move(workers)) {}

  // While a server serves. Without memory for it the helper serves all the same, and tells nothing.
  void begin(ServerContext& server) try {
    status_ = std::make_unique<HelperStatus>(HelperStatus::Sources{.server = server,
                                                                   .lasd = state_.lasd,
                                                                   .heartbeat = state_.heartbeat,
                                                                   .location = state_.location,
                                                                   .version = platform_.version,
                                                                   .socket = platform_.serviceSocket,
                                                                   .workers = workers_,
                                                                   .now = platform_.now});
    // The loop looks at its descriptors first: a client that has started this process gets its reply before
    // this.
    platform_.queues.main().post([this] {
      if (status_ == nullptr || !platform_.serveStatus) return;
      socket_ = platform_.serveStatus([this] { return writeStatus(status_->report()); });
    });
    line_.changed();
  } catch (const std::bad_alloc&) {
    end();
  }
  void end() noexcept {
    socket_.reset();
    status_.reset();
  }
  // Any thread.
  void changed() noexcept { line_.changed(); }

 private:
  const HelperPlatform& platform_;
  const HelperState& state_;
  const Workers workers_;
  std::unique_ptr<HelperStatus> status_;
  std::shared_ptr<void> socket_;
  StatusLine line_{platform_.queues, platform_.serviceManager,
                   [this] { return status_ != nullptr ? status_->line() : std::string("Leaves"); }};
};

}  // namespace

HelperState HelperState::shared(AccountDirectory& accounts) {
  return {.lasd = *LASDUpdater::shared(),
          .heartbeat = CellularHeartbeat::shared(),
          .location = GeoRequestState::shared(),
          .registry = PortServerRegistry::shared(),
          .mobile = [&accounts]() -> MobileUser& { return MobileUser::shared(accounts); }};
}

int runComposed(const HelperPlatform& platform, const HelperState& state) {
  EntitlementCheck entitlements(platform.security, platform.queues, platform.refusalClock);
  std::unique_ptr<Serving> serving;
  const RequestTable<> requests([&] {
    serving = std::make_unique<Serving>(platform, state);
    return &serving->areas();
  });
  Telling telling(platform, state, [&platform, &serving] {
    auto workers = platform.checkInWorkers ? platform.checkInWorkers() : std::vector<StatusReport::Worker>();
    for (auto& each : serving != nullptr ? serving->workers()
                                         : std::vector<StatusReport::Worker>{{"network"}, {"stores"}}) {
      workers.push_back(std::move(each));
    }
    return workers;
  });
  const ServerPlatform server{
      .ports = platform.ports,
      .bootstrap = platform.bootstrap,
      .sources = platform.sources,
      .loop = platform.loop,
      .hasEntitlement =
          [&entitlements](const char* entitlement, const AuditToken& caller) {
            return entitlements.HasEntitlement(entitlement, caller);
          },
      .registry = state.registry,
      .idlePeriod = platform.idlePeriod,
      .describeCaller = [&entitlements](const AuditToken& caller) { return entitlements.describe(caller); },
      .onChange = [&telling] { telling.changed(); },
      .now = platform.now,
      .releaseMemory = platform.releaseMemory};
  const auto endWork = [&telling, &serving] {
    telling.end();
    if (serving != nullptr) serving->shutDown();
  };
  return runHelper(platform.baseband, server, requests, endWork,
                   [&telling](ServerContext& begun) { telling.begin(begun); });
}

}  // namespace brenvik
