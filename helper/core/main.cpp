// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// The composition root: the only file of the helper that names a Linux class.

#include <malloc.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <functional>
#include <memory>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "helper/carrier/CarrierOperations.h"
#include "helper/carrier/FileSystemManager.h"
#include "helper/carrier/PathPolicy.h"
#include "helper/core/EntryPoint.h"
#include "helper/core/HelperStatus.h"
#include "helper/core/StatusLine.h"
#include "helper/entitlement/EntitlementCheck.h"
#include "helper/location/GeoRequestState.h"
#include "helper/mobile/MobileUser.h"
#include "helper/requests/RequestTable.h"
#include "platform/accounts/linux/PasswordDatabase.h"
#include "platform/base/Environment.h"
#include "platform/baseband/linux/LoadedBasebandLibrary.h"
#include "platform/files/linux/LinuxFileManager.h"
#include "platform/files/linux/ZipArchiveCopier.h"
#include "platform/ipc/linux/StatusSocket.h"
#include "platform/ipc/linux/SystemBootstrap.h"
#include "platform/ipc/linux/SystemPortSources.h"
#include "platform/labeler/linux/CatalogueLabeler.h"
#include "platform/log/linux/SystemLog.h"
#include "platform/messageport/linux/ChannelMessagePorts.h"
#include "platform/network/linux/NetworkAnswers.h"
#include "platform/network/linux/RemoteEchoNetwork.h"
#include "platform/network/linux/RemoteGeoService.h"
#include "platform/network/linux/RemoteGunzip.h"
#include "platform/network/linux/RemoteWebClient.h"
#include "platform/preferences/linux/FilePreferences.h"
#include "platform/radio/linux/ModemManagerLogs.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/security/linux/CallerReader.h"
#include "platform/security/linux/EntitlementFiles.h"
#include "platform/servicemanager/linux/NotifySocket.h"
#include "platform/stores/RemoteContacts.h"
#include "platform/stores/RemoteVoicemailStore.h"
#include "platform/stores/linux/PreparedFolder.h"
#include "platform/telephony/linux/ChannelTelephonyDaemon.h"
#include "platform/voicemail/linux/DynamicVisualVoicemail.h"
#include "platform/worker/linux/WorkerProgram.h"

namespace brenvik {
namespace {

// A client takes two descriptors, and its process one: 4,000 clients of as many processes, and as much again.
constexpr rlim_t kDescriptors = 16384;

// What programs look for in the file of this one, in the form of what(1), to learn which version is
// installed.
[[gnu::used, gnu::retain]] constexpr char kWhat[] = "@(#)BrenvikMobileHelper " BRENVIK_VERSION;
constexpr const char* kVersion = kWhat + sizeof "@(#)BrenvikMobileHelper";

void prepareProcess() noexcept {
  rlimit descriptors{};
  if (::getrlimit(RLIMIT_NOFILE, &descriptors) == 0) {
    // Up to what is wanted, and down from the hard limit by what the queues may need beyond.
    constexpr rlim_t kReserved = SystemQueues::kReservedDescriptors;
    const rlim_t most =
        descriptors.rlim_max > 2 * kReserved ? descriptors.rlim_max - kReserved : descriptors.rlim_max;
    const rlim_t wanted = std::min(std::max(kDescriptors, descriptors.rlim_cur), most);
    if (wanted != descriptors.rlim_cur) {
      descriptors.rlim_cur = wanted;
      (void)::setrlimit(RLIMIT_NOFILE, &descriptors);
    }
  }
  // A reader of standard error that went away must not end the process, nor a file that reaches the size
  // limit: both are errors of the call that met them.
  (void)std::signal(SIGPIPE, SIG_IGN);
  (void)std::signal(SIGXFSZ, SIG_IGN);
  (void)::umask(022);
}

// What serves the requests: the areas, and the platform below them that only requests need.
class Serving {
 public:
  Serving(SystemQueues& queues, SystemRegions& regions, PasswordDatabase& accounts)
      : queues_(queues), regions_(regions), mobile_(MobileUser::shared(accounts)) {
    LASDUpdater::shared()->configure({.queues = queues_,
                                      .web = web_,
                                      .gunzip = gunzip_,
                                      .preferences = preferences_,
                                      .messagePorts = messagePorts_});
    CellularHeartbeat::shared().configure({.queues = queues_, .network = echoNetwork_});
  }
  Serving(const Serving&) = delete;
  Serving& operator=(const Serving&) = delete;

  RequestAreas& areas() noexcept { return areas_; }

  // Processes that work for this one.
  std::vector<StatusReport::Worker> workers() const {
    return {{"network", networkWorker_.isRunning()}, {"stores", storeWorker_.isRunning()}};
  }

  // Ends the work of other threads.
  void shutDown() noexcept {
    // The first two let a transfer and an unpacking under way end, for which a check would wait.
    networkAnswers_.shutDown();
    gunzip_.shutDown();
    LASDUpdater::shared()->shutDown();
    CellularHeartbeat::shared().shutDown();
  }

 private:
  MobileAccount account() const { return {mobile_.homeDirectory(), mobile_.uid(), mobile_.gid()}; }
  PreparedFolder::Account storeAccount() const {
    const char* const home = mobile_.homeDirectory();
    return {home != nullptr ? home : "", mobile_.uid(), mobile_.gid()};
  }

  SystemQueues& queues_;
  SystemRegions& regions_;
  MobileUser& mobile_;

  FilePreferences preferences_;
  LinuxFileManager files_;
  PreferenceTransfer preferenceTransfer_{preferences_, regions_, [this](const char* path) {
                                           return FileSystemManager(files_).readDictionary(path);
                                         }};
  PathPolicy policy_{[this] { return account(); }};
  CarrierOperations carrier_{FileSystemManager::factory(files_), ZipArchiveCopier::factory(), policy_,
                             preferences_, [this] { return account(); }};
  ModemManagerLogs radio_{queues_};
  RadioLogging radioLogging_{radio_};

  CatalogueLabeler labeler_;
  LabelRoutines labels_{labeler_, regions_};
  WorkerProgram storeWorker_{{.service = stores::kService,
                              .program = stores::kProgram,
                              .bootstrap = BRENVIK_BOOTSTRAP_DIRECTORY,
                              .folders = {}}};
  PreparedFolder contactsFolder_{[this] { return storeAccount(); }, "AddressBook", stores::kContactsFile};
  RemoteContacts contacts_{storeWorker_, contactsFolder_};
  ChannelRemap channelRemap_{contacts_};

  WorkerProgram networkWorker_{{.service = kNetworkWorkerService,
                                .program = BRENVIK_NETWORK_WORKER,
                                .bootstrap = BRENVIK_BOOTSTRAP_DIRECTORY,
                                .folders = {}}};
  NetworkAnswers networkAnswers_{queues_, networkWorker_};
  RemoteWebClient web_{networkAnswers_};
  RemoteGunzip gunzip_{networkWorker_};
  ChannelMessagePorts messagePorts_{BRENVIK_BOOTSTRAP_DIRECTORY};
  RemoteEchoNetwork echoNetwork_{networkWorker_};

  PreparedFolder voicemailFolder_{[this] { return storeAccount(); }, "Voicemail", stores::kVoicemailFile};
  RemoteVoicemailStore voicemailStore_{storeWorker_, voicemailFolder_};
  DynamicVisualVoicemail visualVoicemail_{BRENVIK_VISUAL_VOICEMAIL_LIBRARY, BRENVIK_VISUAL_VOICEMAIL_SYMBOL};
  VoicemailOperations voicemail_{voicemailStore_, visualVoicemail_};

  RemoteGeoService geoService_{networkAnswers_, {.configuration = BRENVIK_COUNTRY_CONFIGURATION}};
  ChannelTelephonyDaemon telephonyDaemon_{BRENVIK_BOOTSTRAP_DIRECTORY};
  LocationRoutines location_{queues_, geoService_, telephonyDaemon_, GeoRequestState::shared()};

  RequestAreas areas_{PortServerRegistry::shared(),
                      preferenceTransfer_,
                      carrier_,
                      voicemail_,
                      location_,
                      radioLogging_,
                      labels_,
                      channelRemap_,
                      *LASDUpdater::shared(),
                      CellularHeartbeat::shared()};
};

// What the process tells about itself: at its status socket, and to the service manager in one line. Both
// come after the first reply, for which somebody waits.
class Telling {
 public:
  // Processes that work for this one, and whether each runs at this moment; main loop only.
  using Workers = std::function<std::vector<StatusReport::Worker>()>;

  Telling(SystemPortSpace& ports, RunLoop& loop, WorkQueues& queues, Workers workers = {})
      : ports_(ports), loop_(loop), queues_(queues), workers_(std::move(workers)) {}

  // While a server serves. Without memory for it the helper serves all the same, and tells nothing.
  void begin(ServerContext& server) try {
    status_ = std::make_unique<HelperStatus>(HelperStatus::Sources{.server = server,
                                                                   .lasd = *LASDUpdater::shared(),
                                                                   .heartbeat = CellularHeartbeat::shared(),
                                                                   .location = GeoRequestState::shared(),
                                                                   .version = kVersion,
                                                                   .socket = serviceSocket_,
                                                                   .workers = workers_});
    // The loop looks at its descriptors first: a client that has started this process gets its reply before
    // this.
    queues_.main().post([this] {
      if (status_ == nullptr) return;
      socket_ = StatusSocket::make(ports_, loop_, serviceSocket_,
                                   [this] { return writeStatus(status_->report()); });
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
  const std::string serviceSocket_ = std::string(BRENVIK_BOOTSTRAP_DIRECTORY "/") + kServiceName;

  SystemPortSpace& ports_;
  RunLoop& loop_;
  WorkQueues& queues_;
  const Workers workers_;
  std::unique_ptr<HelperStatus> status_;
  std::unique_ptr<StatusSocket> socket_;
  NotifySocket serviceManager_;
  StatusLine line_{queues_, serviceManager_,
                   [this] { return status_ != nullptr ? status_->line() : std::string("Leaves"); }};
};

int run() {
  prepareProcess();
  const auto loop = SystemRunLoop::make();
  if (loop == nullptr) {
    logUnified(LogLevel::error, "unable to startup BrenvikMobileHelper server");
    return 1;
  }
  SystemQueues queues(*loop);
  PasswordDatabase accounts;
  // Asked only where this process lacks the capability that reads other accounts' executables, as under its
  // unit; with root's rights of its own it reads them itself.
  WorkerProgram callerWorker({.service = callers::kService,
                              .program = callers::kProgram,
                              .bootstrap = BRENVIK_BOOTSTRAP_DIRECTORY,
                              .folders = {},
                              .isOnlyService = true});
  RemoteCallerReader callerReader(callerWorker);
  EntitlementFiles security(accounts, &callerReader);
  EntitlementCheck entitlements(security, queues);

  SystemPortSpace ports;
  SystemRegions regions;
  SystemPortSources sources(ports, regions);
  SystemBootstrap bootstrap(ports, BRENVIK_BOOTSTRAP_DIRECTORY, BRENVIK_SERVICE_GROUP);
  LoadedBasebandLibrary baseband;

  std::unique_ptr<Serving> serving;
  const RequestTable<> requests([&] {
    serving = std::make_unique<Serving>(queues, regions, accounts);
    return &serving->areas();
  });
  const auto describeCaller = [&entitlements](const AuditToken& caller) {
    return entitlements.describe(caller);
  };
  Telling telling(ports, *loop, queues, [&serving] {
    return serving != nullptr ? serving->workers()
                              : std::vector<StatusReport::Worker>{{"network"}, {"stores"}};
  });
  const ServerPlatform platform{.ports = ports,
                                .bootstrap = bootstrap,
                                .sources = sources,
                                .loop = *loop,
                                .hasEntitlement =
                                    [&entitlements](const char* entitlement, const AuditToken& caller) {
                                      return entitlements.HasEntitlement(entitlement, caller);
                                    },
                                .idlePeriod = std::chrono::milliseconds(BRENVIK_IDLE_MILLISECONDS),
                                .describeCaller = describeCaller,
                                .onChange = [&telling] { telling.changed(); },
                                .releaseMemory = [] { (void)::malloc_trim(0); }};
  const auto endWork = [&telling, &serving] {
    telling.end();
    if (serving != nullptr) serving->shutDown();
  };
  return runHelper(baseband, platform, requests, endWork,
                   [&telling](ServerContext& server) { telling.begin(server); });
}

}  // namespace
}  // namespace brenvik

int main() {
  // First of all: nothing that comes later is to find anything there. These are the service manager's way to
  // hand over the listening socket and to be told, and go when they have been taken.
  brenvik::clearEnvironmentExcept(
      {"LISTEN_PID", "LISTEN_FDS", "LISTEN_FDNAMES", brenvik::NotifySocket::kVariable});
  brenvik::SystemLog log("BrenvikMobileHelper");
  brenvik::setLogSink(&log);
  const int status = brenvik::runReportingFailure(brenvik::run);
  brenvik::setLogSink(nullptr);
  return status;
}
