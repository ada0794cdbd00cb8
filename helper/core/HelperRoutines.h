// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "Helper/Shared/Server/HelperServerUtils.h"
#include "helper/carrier/CarrierOperations.h"
#include "helper/heartbeat/CellularHeartbeat.h"
#include "helper/labels/ChannelRemap.h"
#include "helper/labels/LabelRoutines.h"
#include "helper/lasd/LASDUpdater.h"
#include "helper/location/LocationRoutines.h"
#include "helper/mobile/RadioLogging.h"
#include "helper/preferences/PreferenceTransfer.h"
#include "helper/requests/ServerRoutines.h"
#include "helper/voicemail/VoicemailOperations.h"

namespace brenvik {

// Hands each server routine to the area that owns it.
class HelperRoutines final : public ServerRoutines {
 public:
  // The areas; each outlives the routines.
  struct Areas {
    PreferenceTransfer& preferences;
    CarrierOperations& carrier;
    VoicemailOperations& voicemail;
    LocationRoutines& location;
    RadioLogging& radioLogging;
    LabelRoutines& labels;
    ChannelRemap& channelRemap;
    LASDUpdater& lasd;
    CellularHeartbeat& heartbeat;
    PortServerRegistry& registry = PortServerRegistry::shared();
  };
  explicit HelperRoutines(const Areas& areas) noexcept : areas_(areas) {}

  KernelReturn server_BVMobileHelperSetVoicemailToken(PortName port, char* token) override {
    return areas_.voicemail.setVoicemailToken(port, token);
  }
  KernelReturn server_BVMobileHelperSetVoicemailTokenForKey(PortName port, char* key, char* token) override {
    return areas_.voicemail.setVoicemailTokenForKey(port, key, token);
  }
  KernelReturn server_BVMobileHelperClearVoicemailToken(PortName port) override {
    return areas_.voicemail.clearVoicemailToken(port);
  }
  KernelReturn server_BVMobileHelperResetVoicemailStore(PortName port) override {
    return areas_.voicemail.resetVoicemailStore(port);
  }
  KernelReturn server_BVMobileHelperCopyVoicemailTokenForKey(PortName port, char* key, char* token) override {
    return areas_.voicemail.copyVoicemailTokenForKey(port, key, token);
  }
  KernelReturn server_BVMobileHelperCopyVoicemailToken(PortName port, char* token) override {
    return areas_.voicemail.copyVoicemailToken(port, token);
  }
  KernelReturn server_BVMobileHelperIsVoicemailServiceSubscribed(PortName port,
                                                                 std::uint8_t* subscribed) override {
    return areas_.voicemail.isVoicemailServiceSubscribed(port, subscribed);
  }
  KernelReturn server_BVMobileHelperUnpackArchive(PortName port, char* archivePath, char* destinationPath,
                                                  std::uint8_t* success) override {
    return areas_.carrier.unpackArchive(port, archivePath, destinationPath, success);
  }
  KernelReturn server_BVMobileHelperRequestCountryCodeFromLocation(PortName port, double latitude,
                                                                   double longitude) override {
    return areas_.location.server_BVMobileHelperRequestCountryCodeFromLocation(port, latitude, longitude);
  }
  KernelReturn server_BVMobileHelperCopyCountryCode(PortName port, char* code) override {
    return areas_.location.server_BVMobileHelperCopyCountryCode(port, code);
  }
  KernelReturn server_BVMobileHelperRequestWanIPFromLocation(PortName port) override {
    return areas_.location.server_BVMobileHelperRequestWanIPFromLocation(port);
  }
  KernelReturn server_BVMobileHelperSetPreferenceValue(PortName port, char* domain, char* key,
                                                       const void* value, std::uint32_t length) override {
    return areas_.preferences.setPreferenceValue(port, domain, key, value, length);
  }
  KernelReturn server_BVMobileHelperCopyPreferenceValue(PortName port, char* domain, char* key,
                                                        OutOfLinePayload* value) override {
    return areas_.preferences.copyPreferenceValue(port, domain, key, value);
  }
  KernelReturn server_BVMobileHelperCopyAppPreferenceValue(PortName port, char* domain, char* key,
                                                           OutOfLinePayload* value) override {
    return areas_.preferences.copyAppPreferenceValue(port, domain, key, value);
  }
  KernelReturn server_BVMobileHelperLoadPlistFile(PortName port, char* path,
                                                  OutOfLinePayload* contents) override {
    return areas_.preferences.loadPlistFile(port, path, contents);
  }
  KernelReturn server_BVMobileHelperReplaceCarrierSymlink(PortName port, char* target, char* linkPath,
                                                          char* domain) override {
    return areas_.carrier.replaceCarrierSymlink(port, target, linkPath, domain);
  }
  KernelReturn server_BVMobileHelperCreateSymlink(PortName port, char* target, char* linkPath) override {
    return areas_.carrier.createSymlink(port, target, linkPath);
  }
  KernelReturn server_BVMobileHelperRemoveCarrierFile(PortName port, char* path, char* domain) override {
    return areas_.carrier.removeCarrierFile(port, path, domain);
  }
  KernelReturn server_BVMobileHelperCopyCarrierFile(PortName port, char* sourceDirectory,
                                                    char* destinationDirectory, char* fileName,
                                                    std::uint8_t* success) override {
    return areas_.carrier.copyCarrierFile(port, sourceDirectory, destinationDirectory, fileName, success);
  }
  KernelReturn server_BVMobileHelperCopyCrashLogs(PortName port, char* path, std::uint8_t* success) override {
    return areas_.carrier.copyCrashLogs(port, path, success);
  }
  KernelReturn server_BVMobileHelperMoveIntoCarrierBundles(PortName port, char* sourcePath,
                                                           char* destinationDirectory, char* name,
                                                           std::uint8_t* success) override {
    return areas_.carrier.moveIntoCarrierBundles(port, sourcePath, destinationDirectory, name, success);
  }
  KernelReturn server_BVMobileHelperEnableRadioManagerLogs(PortName port, std::int32_t enable) override {
    return areas_.radioLogging.BVMobileHelperEnableRadioManagerLogs(port, enable);
  }
  KernelReturn server_BVMobileHelperCopyBadgeLabels(PortName, const void* labels, std::uint32_t labelsLength,
                                                    const void* languages, std::uint32_t languagesLength,
                                                    OutOfLinePayload* badges) override {
    return areas_.labels.CopyBadgeLabels(labels, labelsLength, languages, languagesLength, badges);
  }
  KernelReturn server_BVMobileHelperCopyLocalizedLabels(PortName, const void* labels,
                                                        std::uint32_t labelsLength, const void* languages,
                                                        std::uint32_t languagesLength,
                                                        OutOfLinePayload* texts) override {
    return areas_.labels.CopyLocalizedLabels(labels, labelsLength, languages, languagesLength, texts);
  }
  KernelReturn server_BVMobileHelperRemapContactsChannel(PortName, char* from, char* to,
                                                         std::uint8_t* success) override {
    return areas_.channelRemap.RemapContactsChannel(from, to, success);
  }
  KernelReturn server_BVMobileHelperCellularHeartbeat(PortName port, std::int32_t value) override {
    ServerContext* const server = LookupServer(areas_.registry, port);
    if (server == nullptr) return kern::failure;
    areas_.heartbeat.setHeartbeat(*server, value != 0);
    return kern::success;
  }
  KernelReturn server_BVMobileHelperCheckLASDUpdate(PortName port, std::int32_t mask) override {
    ServerContext* const server = LookupServer(areas_.registry, port);
    if (server == nullptr) return kern::failure;
    areas_.lasd.checkForUpdate(*server, static_cast<std::uint32_t>(mask));
    return kern::success;
  }

 private:
  const Areas areas_;
};

}  // namespace brenvik
