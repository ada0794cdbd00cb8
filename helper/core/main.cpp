// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// The composition root: the only file of the helper that names a Linux class.

#include <sys/resource.h>
#include <sys/stat.h>

#include <algorithm>
#include <csignal>
#include <cstdio>
#include <exception>
#include <string>

#include "helper/carrier/CarrierOperations.h"
#include "helper/carrier/FileSystemManager.h"
#include "helper/carrier/PathPolicy.h"
#include "helper/core/EntryPoint.h"
#include "helper/core/HelperRoutines.h"
#include "helper/entitlement/EntitlementCheck.h"
#include "helper/location/GeoRequestState.h"
#include "helper/mobile/MobileUser.h"
#include "helper/requests/RequestTable.h"
#include "platform/accounts/linux/PasswordDatabase.h"
#include "platform/baseband/linux/LoadedBasebandLibrary.h"
#include "platform/contacts/linux/SqliteContacts.h"
#include "platform/files/linux/LinuxFileManager.h"
#include "platform/files/linux/ZipArchiveCopier.h"
#include "platform/geo/linux/SystemGeoService.h"
#include "platform/ipc/linux/SystemBootstrap.h"
#include "platform/ipc/linux/SystemPortSources.h"
#include "platform/labeler/linux/CatalogueLabeler.h"
#include "platform/log/linux/SystemLog.h"
#include "platform/messageport/linux/ChannelMessagePorts.h"
#include "platform/net/linux/SystemEchoNetwork.h"
#include "platform/preferences/linux/FilePreferences.h"
#include "platform/radio/linux/ModemManagerLogs.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/security/linux/EntitlementFiles.h"
#include "platform/telephony/linux/ChannelTelephonyDaemon.h"
#include "platform/voicemail/linux/DynamicVisualVoicemail.h"
#include "platform/voicemail/linux/SqliteVoicemailStore.h"
#include "platform/web/linux/LoadedWebModule.h"

namespace brenvik {
namespace {

// A client takes four descriptors; the usual limit of 1,024 would be 250 of them.
constexpr rlim_t kDescriptors = 8192;

void prepareProcess() noexcept {
  rlimit descriptors{};
  if (::getrlimit(RLIMIT_NOFILE, &descriptors) == 0 && descriptors.rlim_cur < kDescriptors) {
    descriptors.rlim_cur = std::min(kDescriptors, descriptors.rlim_max);
    (void)::setrlimit(RLIMIT_NOFILE, &descriptors);
  }
  // A reader of standard error that went away must not end the process, nor a file that reaches the size
  // limit: both are errors of the call that met them.
  (void)std::signal(SIGPIPE, SIG_IGN);
  (void)std::signal(SIGXFSZ, SIG_IGN);
  (void)::umask(022);
}

int run() {
  prepareProcess();
  SystemLog log("BrenvikMobileHelper");
  setLogSink(&log);

  const auto loop = SystemRunLoop::make();
  if (loop == nullptr) {
    logUnified(LogLevel::error, "unable to startup BrenvikMobileHelper server");
    return 1;
  }
  SystemQueues queues(*loop);
  PasswordDatabase accounts;
  MobileUser& mobile = MobileUser::processWide(accounts);
  const auto mobileHome = [&mobile] {
    const char* const home = mobile.homeDirectory();
    return std::string(home != nullptr ? home : "");
  };
  EntitlementFiles security(accounts);
  EntitlementCheck entitlements(security, queues);

  SystemPortSpace ports;
  SystemRegions regions;
  SystemPortSources sources(ports, regions);
  SystemBootstrap bootstrap(ports, BRENVIK_BOOTSTRAP_DIRECTORY);
  LoadedBasebandLibrary baseband;

  FilePreferences preferences;
  LinuxFileManager files;
  PreferenceTransfer preferenceTransfer(preferences, regions, [&files](const char* path) {
    return FileSystemManager(files).readDictionary(path);
  });
  const auto mobileAccount = [&mobile] {
    return MobileAccount{mobile.homeDirectory(), mobile.uid(), mobile.gid()};
  };
  PathPolicy policy(mobileAccount);
  CarrierOperations carrier(FileSystemManager::factory(files), ZipArchiveCopier::factory(), policy,
                            preferences, mobileAccount);
  ModemManagerLogs radio(queues);
  RadioLogging radioLogging(radio);

  CatalogueLabeler labeler;
  LabelRoutines labels(labeler, regions);
  SqliteContacts contacts(mobileHome);
  ChannelRemap channelRemap(contacts);

  LoadedWebModule web(queues);
  ChannelMessagePorts messagePorts(BRENVIK_BOOTSTRAP_DIRECTORY);
  const auto& lasd = LASDUpdater::shared();
  lasd->configure({.queues = queues,
                   .web = web.webClient(),
                   .gunzip = web.gunzip(),
                   .preferences = preferences,
                   .messagePorts = messagePorts});
  SystemEchoNetwork echoNetwork;
  CellularHeartbeat& heartbeat = CellularHeartbeat::shared();
  heartbeat.configure({.queues = queues, .network = echoNetwork});

  SqliteVoicemailStore voicemailStore([&mobile, mobileHome] {
    return SqliteVoicemailStore::Account{mobileHome(), mobile.uid(), mobile.gid()};
  });
  DynamicVisualVoicemail visualVoicemail(BRENVIK_VISUAL_VOICEMAIL_LIBRARY, BRENVIK_VISUAL_VOICEMAIL_SYMBOL);
  VoicemailOperations voicemail(voicemailStore, visualVoicemail);

  SystemGeoService geoService(queues, web.webClient(),
                              {.geocoderUrl = BRENVIK_GEOCODER_URL,
                               .gazetteer = BRENVIK_GAZETTEER,
                               .stunServer = BRENVIK_STUN_SERVER,
                               .countryFiles = {.configuration = BRENVIK_COUNTRY_CONFIGURATION}});
  ChannelTelephonyDaemon telephonyDaemon(BRENVIK_BOOTSTRAP_DIRECTORY);
  LocationRoutines location(queues, geoService, telephonyDaemon, GeoRequestState::shared());

  HelperRoutines routines({.preferences = preferenceTransfer,
                           .carrier = carrier,
                           .voicemail = voicemail,
                           .location = location,
                           .radioLogging = radioLogging,
                           .labels = labels,
                           .channelRemap = channelRemap,
                           .lasd = *lasd,
                           .heartbeat = heartbeat});
  const RequestTable requests(routines);
  const ServerPlatform platform{ports, bootstrap, sources, *loop,
                                [&entitlements](const char* entitlement, const AuditToken& caller) {
                                  return entitlements.HasEntitlement(entitlement, caller);
                                }};
  const auto endWork = [&] {
    // The first lets a transfer under way end, for which a check would wait.
    web.shutDown();
    lasd->shutDown();
    heartbeat.shutDown();
  };
  const int status = runHelper(baseband, platform, requests, endWork);
  setLogSink(nullptr);
  return status;
}

}  // namespace
}  // namespace brenvik

int main() {
  try {
    return brenvik::run();
  } catch (const std::exception& error) {
    std::fprintf(stderr, "<3>unable to startup BrenvikMobileHelper server: %s\n", error.what());
    return 1;
  }
}
