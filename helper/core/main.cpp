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
#include <string>
#include <utility>
#include <vector>

#include "helper/core/Composition.h"
#include "helper/core/EntryPoint.h"
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

// The platform below the requests.
class LinuxRequestPlatform final : public RequestPlatform {
 public:
  LinuxRequestPlatform(SystemQueues& queues, MobileUser& mobile) : queues_(queues), mobile_(mobile) {}
  LinuxRequestPlatform(const LinuxRequestPlatform&) = delete;
  LinuxRequestPlatform& operator=(const LinuxRequestPlatform&) = delete;

  Roles roles() override {
    return {.preferences = preferences_,
            .files = files_,
            .archives = ZipArchiveCopier::factory(),
            .radio = radio_,
            .labeler = labeler_,
            .contacts = contacts_,
            .web = web_,
            .gunzip = gunzip_,
            .messagePorts = messagePorts_,
            .echoNetwork = echoNetwork_,
            .voicemail = voicemailStore_,
            .visualVoicemail = visualVoicemail_,
            .geo = geoService_,
            .telephony = telephonyDaemon_};
  }
  std::vector<StatusReport::Worker> workers() const override {
    return {{"network", networkWorker_.isRunning()}, {"stores", storeWorker_.isRunning()}};
  }
  // Lets a transfer and an unpacking under way end, for which a check would wait.
  void shutDown() noexcept override {
    networkAnswers_.shutDown();
    gunzip_.shutDown();
  }

 private:
  PreparedFolder::Account storeAccount() const {
    const char* const home = mobile_.homeDirectory();
    return {home != nullptr ? home : "", mobile_.uid(), mobile_.gid()};
  }

  SystemQueues& queues_;
  MobileUser& mobile_;

  FilePreferences preferences_;
  LinuxFileManager files_;
  ModemManagerLogs radio_{queues_};
  CatalogueLabeler labeler_;

  WorkerProgram storeWorker_{{.service = stores::kService,
                              .program = stores::kProgram,
                              .bootstrap = BRENVIK_BOOTSTRAP_DIRECTORY,
                              .folders = {}}};
  PreparedFolder contactsFolder_{[this] { return storeAccount(); }, "AddressBook", stores::kContactsFile};
  RemoteContacts contacts_{storeWorker_, contactsFolder_};
  PreparedFolder voicemailFolder_{[this] { return storeAccount(); }, "Voicemail", stores::kVoicemailFile};
  RemoteVoicemailStore voicemailStore_{storeWorker_, voicemailFolder_};
  DynamicVisualVoicemail visualVoicemail_{BRENVIK_VISUAL_VOICEMAIL_LIBRARY, BRENVIK_VISUAL_VOICEMAIL_SYMBOL};

  WorkerProgram networkWorker_{{.service = kNetworkWorkerService,
                                .program = BRENVIK_NETWORK_WORKER,
                                .bootstrap = BRENVIK_BOOTSTRAP_DIRECTORY,
                                .folders = {}}};
  NetworkAnswers networkAnswers_{queues_, networkWorker_};
  RemoteWebClient web_{networkAnswers_};
  RemoteGunzip gunzip_{networkWorker_};
  ChannelMessagePorts messagePorts_{BRENVIK_BOOTSTRAP_DIRECTORY};
  RemoteEchoNetwork echoNetwork_{networkWorker_};
  RemoteGeoService geoService_{networkAnswers_, {.configuration = BRENVIK_COUNTRY_CONFIGURATION}};
  ChannelTelephonyDaemon telephonyDaemon_{BRENVIK_BOOTSTRAP_DIRECTORY};
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

  SystemPortSpace ports;
  SystemRegions regions;
  SystemPortSources sources(ports, regions);
  SystemBootstrap bootstrap(ports, BRENVIK_BOOTSTRAP_DIRECTORY, BRENVIK_SERVICE_GROUP);
  LoadedBasebandLibrary baseband;
  NotifySocket serviceManager;

  const std::string serviceSocket = std::string(BRENVIK_BOOTSTRAP_DIRECTORY "/") + kServiceName;
  const HelperPlatform platform{
      .loop = *loop,
      .queues = queues,
      .security = security,
      .ports = ports,
      .regions = regions,
      .sources = sources,
      .bootstrap = bootstrap,
      .baseband = baseband,
      .serviceManager = serviceManager,
      .checkInWorkers =
          [&callerWorker] {
            // One that is never asked would look like one that is missing.
            return readsCallersByItself()
                       ? std::vector<StatusReport::Worker>()
                       : std::vector<StatusReport::Worker>{{"callers", callerWorker.isRunning()}};
          },
      .makeRequestPlatform =
          [&queues](MobileUser& mobile) { return std::make_unique<LinuxRequestPlatform>(queues, mobile); },
      .serveStatus =
          [&](std::function<std::string()> report) {
            return std::shared_ptr<void>(StatusSocket::make(ports, *loop, serviceSocket, std::move(report)));
          },
      .version = kVersion,
      .serviceSocket = serviceSocket,
      .idlePeriod = std::chrono::milliseconds(BRENVIK_IDLE_MILLISECONDS),
      .releaseMemory = [] { (void)::malloc_trim(0); }};
  return runComposed(platform, HelperState::shared(accounts));
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
