// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "helper/requests/ServerRoutines.h"

namespace brenvik {

// Writes down each call, returns what the test wants and answers with recognisable results.
class RecordingRoutines final : public ServerRoutines {
 public:
  std::string called;
  PortName port = kNullPort;
  std::vector<std::string> texts;
  std::int32_t integer = 0;
  double latitude = 0;
  double longitude = 0;
  std::string firstRegion;
  std::string secondRegion;
  KernelReturn answer = kern::success;
  std::function<void()> whenCalled;  // runs within each routine

  KernelReturn server_BVMobileHelperSetVoicemailToken(PortName p, char* token) override {
    return note("SetVoicemailToken", p, {text(token, 256)});
  }
  KernelReturn server_BVMobileHelperSetVoicemailTokenForKey(PortName p, char* key, char* token) override {
    return note("SetVoicemailTokenForKey", p, {text(key, 256), text(token, 256)});
  }
  KernelReturn server_BVMobileHelperClearVoicemailToken(PortName p) override {
    return note("ClearVoicemailToken", p, {});
  }
  KernelReturn server_BVMobileHelperResetVoicemailStore(PortName p) override {
    return note("ResetVoicemailStore", p, {});
  }
  KernelReturn server_BVMobileHelperCopyVoicemailTokenForKey(PortName p, char* key, char* token) override {
    std::strcpy(token, "a token");
    return note("CopyVoicemailTokenForKey", p, {text(key, 256)});
  }
  KernelReturn server_BVMobileHelperCopyVoicemailToken(PortName p, char* token) override {
    std::memset(token, 'x', 256);
    return note("CopyVoicemailToken", p, {});
  }
  KernelReturn server_BVMobileHelperSetPreferenceValue(PortName p, char* domain, char* key, const void* value,
                                                       std::uint32_t length) override {
    firstRegion.assign(static_cast<const char*>(value), length);
    return note("SetPreferenceValue", p, {text(domain, 256), text(key, 256)});
  }
  KernelReturn server_BVMobileHelperCopyPreferenceValue(PortName p, char* domain, char* key,
                                                        OutOfLinePayload* value) override {
    *value = payload;
    return note("CopyPreferenceValue", p, {text(domain, 256), text(key, 256)});
  }
  KernelReturn server_BVMobileHelperCopyAppPreferenceValue(PortName p, char* domain, char* key,
                                                           OutOfLinePayload* value) override {
    *value = payload;
    return note("CopyAppPreferenceValue", p, {text(domain, 256), text(key, 256)});
  }
  KernelReturn server_BVMobileHelperReplaceCarrierSymlink(PortName p, char* target, char* link,
                                                          char* domain) override {
    return note("ReplaceCarrierSymlink", p, {text(target, 1024), text(link, 1024), text(domain, 1024)});
  }
  KernelReturn server_BVMobileHelperCreateSymlink(PortName p, char* target, char* link) override {
    return note("CreateSymlink", p, {text(target, 1024), text(link, 1024)});
  }
  KernelReturn server_BVMobileHelperRemoveCarrierFile(PortName p, char* path, char* domain) override {
    return note("RemoveCarrierFile", p, {text(path, 1024), text(domain, 1024)});
  }
  KernelReturn server_BVMobileHelperIsVoicemailServiceSubscribed(PortName p,
                                                                 std::uint8_t* subscribed) override {
    *subscribed = 1;
    return note("IsVoicemailServiceSubscribed", p, {});
  }
  KernelReturn server_BVMobileHelperCellularHeartbeat(PortName p, std::int32_t value) override {
    integer = value;
    return note("CellularHeartbeat", p, {});
  }
  KernelReturn server_BVMobileHelperCheckLASDUpdate(PortName p, std::int32_t mask) override {
    integer = mask;
    return note("CheckLASDUpdate", p, {});
  }
  KernelReturn server_BVMobileHelperCopyCarrierFile(PortName p, char* source, char* destination, char* name,
                                                    std::uint8_t* success) override {
    *success = 1;
    return note("CopyCarrierFile", p, {text(source, 256), text(destination, 256), text(name, 256)});
  }
  KernelReturn server_BVMobileHelperCopyCrashLogs(PortName p, char* path, std::uint8_t* success) override {
    *success = 1;
    return note("CopyCrashLogs", p, {text(path, 256)});
  }
  KernelReturn server_BVMobileHelperMoveIntoCarrierBundles(PortName p, char* source, char* destination,
                                                           char* name, std::uint8_t* success) override {
    *success = 1;
    return note("MoveIntoCarrierBundles", p, {text(source, 256), text(destination, 256), text(name, 256)});
  }
  KernelReturn server_BVMobileHelperRequestCountryCodeFromLocation(PortName p, double lat,
                                                                   double lon) override {
    latitude = lat;
    longitude = lon;
    return note("RequestCountryCodeFromLocation", p, {});
  }
  KernelReturn server_BVMobileHelperCopyCountryCode(PortName p, char* code) override {
    std::strcpy(code, "NO");
    return note("CopyCountryCode", p, {});
  }
  KernelReturn server_BVMobileHelperRequestWanIPFromLocation(PortName p) override {
    return note("RequestWanIPFromLocation", p, {});
  }
  KernelReturn server_BVMobileHelperEnableRadioManagerLogs(PortName p, std::int32_t enable) override {
    integer = enable;
    return note("EnableRadioManagerLogs", p, {});
  }
  KernelReturn server_BVMobileHelperUnpackArchive(PortName p, char* archive, char* destination,
                                                  std::uint8_t* success) override {
    *success = 1;
    return note("UnpackArchive", p, {text(archive, 256), text(destination, 256)});
  }
  KernelReturn server_BVMobileHelperLoadPlistFile(PortName p, char* path,
                                                  OutOfLinePayload* contents) override {
    *contents = payload;
    return note("LoadPlistFile", p, {text(path, 256)});
  }
  KernelReturn server_BVMobileHelperCopyBadgeLabels(PortName p, const void* labels,
                                                    std::uint32_t labelsLength, const void* languages,
                                                    std::uint32_t languagesLength,
                                                    OutOfLinePayload* badges) override {
    firstRegion.assign(static_cast<const char*>(labels), labelsLength);
    secondRegion.assign(static_cast<const char*>(languages), languagesLength);
    *badges = payload;
    return note("CopyBadgeLabels", p, {});
  }
  KernelReturn server_BVMobileHelperCopyLocalizedLabels(PortName p, const void* labels,
                                                        std::uint32_t labelsLength, const void* languages,
                                                        std::uint32_t languagesLength,
                                                        OutOfLinePayload* localized) override {
    firstRegion.assign(static_cast<const char*>(labels), labelsLength);
    secondRegion.assign(static_cast<const char*>(languages), languagesLength);
    *localized = payload;
    return note("CopyLocalizedLabels", p, {});
  }
  KernelReturn server_BVMobileHelperRemapContactsChannel(PortName p, char* from, char* to,
                                                         std::uint8_t* success) override {
    *success = 1;
    return note("RemapContactsChannel", p, {text(from, 64), text(to, 64)});
  }

  char region[5] = {'b', 'y', 't', 'e', 's'};
  OutOfLinePayload payload{region, sizeof region};

 private:
  // The whole field: the handlers pass it on as it is, terminated or not.
  static std::string text(const char* field, std::size_t size) { return {field, ::strnlen(field, size)}; }
  KernelReturn note(const char* name, PortName p, std::vector<std::string> arguments) {
    called = name;
    if (whenCalled) whenCalled();
    port = p;
    texts = std::move(arguments);
    return answer;
  }
};

}  // namespace brenvik
