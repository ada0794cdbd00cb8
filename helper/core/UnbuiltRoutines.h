// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "helper/requests/ServerRoutines.h"

namespace brenvik {

// What a routine answers while its area is not part of this build: 46, not supported. The one place for that;
// HelperRoutines overrides every routine that exists.
class UnbuiltRoutines : public ServerRoutines {
 public:
  KernelReturn server_BVMobileHelperSetVoicemailToken(PortName, char*) override { return kern::notSupported; }
  KernelReturn server_BVMobileHelperSetVoicemailTokenForKey(PortName, char*, char*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperClearVoicemailToken(PortName) override { return kern::notSupported; }
  KernelReturn server_BVMobileHelperResetVoicemailStore(PortName) override { return kern::notSupported; }
  KernelReturn server_BVMobileHelperCopyVoicemailTokenForKey(PortName, char*, char*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperCopyVoicemailToken(PortName, char*) override { return kern::notSupported; }
  KernelReturn server_BVMobileHelperSetPreferenceValue(PortName, char*, char*, const void*, std::uint32_t) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperCopyPreferenceValue(PortName, char*, char*, OutOfLinePayload*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperCopyAppPreferenceValue(PortName, char*, char*, OutOfLinePayload*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperReplaceCarrierSymlink(PortName, char*, char*, char*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperCreateSymlink(PortName, char*, char*) override { return kern::notSupported; }
  KernelReturn server_BVMobileHelperRemoveCarrierFile(PortName, char*, char*) override { return kern::notSupported; }
  KernelReturn server_BVMobileHelperIsVoicemailServiceSubscribed(PortName, std::uint8_t*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperCellularHeartbeat(PortName, std::int32_t) override { return kern::notSupported; }
  KernelReturn server_BVMobileHelperCheckLASDUpdate(PortName, std::int32_t) override { return kern::notSupported; }
  KernelReturn server_BVMobileHelperCopyCarrierFile(PortName, char*, char*, char*, std::uint8_t*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperCopyCrashLogs(PortName, char*, std::uint8_t*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperMoveIntoCarrierBundles(PortName, char*, char*, char*, std::uint8_t*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperRequestCountryCodeFromLocation(PortName, double, double) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperCopyCountryCode(PortName, char*) override { return kern::notSupported; }
  KernelReturn server_BVMobileHelperRequestWanIPFromLocation(PortName) override { return kern::notSupported; }
  KernelReturn server_BVMobileHelperEnableRadioManagerLogs(PortName, std::int32_t) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperUnpackArchive(PortName, char*, char*, std::uint8_t*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperLoadPlistFile(PortName, char*, OutOfLinePayload*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperCopyBadgeLabels(PortName, const void*, std::uint32_t, const void*, std::uint32_t,
                                                    OutOfLinePayload*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperCopyLocalizedLabels(PortName, const void*, std::uint32_t, const void*,
                                                        std::uint32_t, OutOfLinePayload*) override {
    return kern::notSupported;
  }
  KernelReturn server_BVMobileHelperRemapContactsChannel(PortName, char*, char*, std::uint8_t*) override {
    return kern::notSupported;
  }
};

}  // namespace brenvik
