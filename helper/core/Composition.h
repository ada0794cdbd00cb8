// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "helper/core/EntryPoint.h"
#include "helper/entitlement/EntitlementCheck.h"
#include "helper/heartbeat/CellularHeartbeat.h"
#include "helper/lasd/LASDUpdater.h"
#include "helper/location/GeoRequestState.h"
#include "helper/mobile/MobileUser.h"
#include "interface/status/Status.h"
#include "platform/accounts/AccountDirectory.h"
#include "platform/base/Clock.h"
#include "platform/baseband/HostedBasebandServer.h"
#include "platform/contacts/ContactsChannelManager.h"
#include "platform/files/ArchiveCopier.h"
#include "platform/files/FileManager.h"
#include "platform/geo/GeoService.h"
#include "platform/gzip/Gunzip.h"
#include "platform/ipc/Ports.h"
#include "platform/ipc/RegionAllocator.h"
#include "platform/labeler/SubscriptionLabeler.h"
#include "platform/messageport/MessagePort.h"
#include "platform/net/EchoNetwork.h"
#include "platform/preferences/PreferencesStore.h"
#include "platform/radio/RadioManager.h"
#include "platform/runloop/WorkQueue.h"
#include "platform/security/TaskSecurity.h"
#include "platform/servicemanager/ServiceManager.h"
#include "platform/telephony/TelephonyDaemonConnection.h"
#include "platform/voicemail/VisualVoicemail.h"
#include "platform/voicemail/VoicemailStore.h"
#include "platform/web/WebClient.h"

namespace brenvik {

// The part of the platform that only requests need. It is made with the first request, because the client
// that started the process is waiting for its check-in.
class RequestPlatform {
 public:
  struct Roles {
    PreferencesStore& preferences;
    FileManager& files;
    ArchiveCopierFactory archives;
    RadioManager& radio;
    SubscriptionLabeler& labeler;
    ContactsService& contacts;
    WebClient& web;
    Gunzip& gunzip;
    MessagePorts& messagePorts;
    EchoNetwork& echoNetwork;
    VoicemailStore& voicemail;
    VisualVoicemailLibrary& visualVoicemail;
    GeoService& geo;
    TelephonyDaemon& telephony;
  };

  virtual ~RequestPlatform() = default;
  // What the references name lives as long as this object.
  virtual Roles roles() = 0;
  // The worker processes, and whether each runs now. Main loop only.
  virtual std::vector<StatusReport::Worker> workers() const = 0;
  // Ends the work under way for which the work queues wait.
  virtual void shutDown() noexcept = 0;
};

// The platform that the helper runs on. What the references name must outlive runComposed().
struct HelperPlatform {
  RunLoop& loop;
  WorkQueues& queues;
  TaskSecurity& security;
  PortSpace& ports;
  RegionAllocator& regions;
  PortSources& sources;
  Bootstrap& bootstrap;
  BasebandLibrary& baseband;
  ServiceManager& serviceManager;
  // The worker processes that check-ins need, and whether each runs now. Main loop only. May be empty.
  std::function<std::vector<StatusReport::Worker>()> checkInWorkers = {};
  // Makes the rest at the first request. Throws std::bad_alloc; the next request then calls it again.
  std::function<std::unique_ptr<RequestPlatform>(MobileUser& mobile)> makeRequestPlatform;
  // Begins to answer those who ask for the report, until the result is destroyed. The result may be null. May
  // be empty.
  std::function<std::shared_ptr<void>(std::function<std::string()> report)> serveStatus = {};
  std::string version;
  std::string serviceSocket;
  std::chrono::nanoseconds idlePeriod = std::chrono::seconds(10);
  // Gives freed memory back to the system. May be empty.
  std::function<void()> releaseMemory = {};
  std::function<std::chrono::nanoseconds()> now = timeSinceBoot;
  RefusalLog::Clock refusalClock = EntitlementCheck::steadyTime;
};

// The objects of which a process has one. They outlive runComposed().
struct HelperState {
  LASDUpdater& lasd;
  CellularHeartbeat& heartbeat;
  GeoRequestState& location;
  PortServerRegistry& registry;
  std::function<MobileUser&()> mobile;  // called with the first request

  // Those of this process.
  static HelperState shared(AccountDirectory& accounts);
};

// Makes the helper of its parts and runs it; see runHelper(). Main thread. Returns the exit status.
int runComposed(const HelperPlatform& platform, const HelperState& state);

}  // namespace brenvik
