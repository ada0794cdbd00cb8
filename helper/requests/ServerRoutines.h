// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>

#include "helper/payload/OutOfLinePayload.h"
#include "interface/Wire.h"

namespace brenvik {

// The server side of the 27 request routines, in the order of their ids. Each gets the port its request
// arrived on, then its arguments, and returns a kernel-style code; results are written only with success.
//
// Strings point into the request's field, which has the size that its name or comment says and need not be
// terminated; the older routines cut it in place. Result texts and bytes point into the reply and start as
// zeros. Regions are read in place and stay the transport's. All run on the main loop, one at a time.
class ServerRoutines {
 public:
  virtual ~ServerRoutines() = default;

  // Voicemail store; fields of 256 bytes.
  virtual KernelReturn server_BVMobileHelperSetVoicemailToken(PortName port, char* token) = 0;
  virtual KernelReturn server_BVMobileHelperSetVoicemailTokenForKey(PortName port, char* key,
                                                                    char* token) = 0;
  virtual KernelReturn server_BVMobileHelperClearVoicemailToken(PortName port) = 0;
  virtual KernelReturn server_BVMobileHelperResetVoicemailStore(PortName port) = 0;
  virtual KernelReturn server_BVMobileHelperCopyVoicemailTokenForKey(PortName port, char* key,
                                                                     char* token) = 0;
  virtual KernelReturn server_BVMobileHelperCopyVoicemailToken(PortName port, char* token) = 0;

  // Preferences; fields of 256 bytes.
  virtual KernelReturn server_BVMobileHelperSetPreferenceValue(PortName port, char* domain, char* key,
                                                               const void* value, std::uint32_t length) = 0;
  virtual KernelReturn server_BVMobileHelperCopyPreferenceValue(PortName port, char* domain, char* key,
                                                                OutOfLinePayload* value) = 0;
  virtual KernelReturn server_BVMobileHelperCopyAppPreferenceValue(PortName port, char* domain, char* key,
                                                                   OutOfLinePayload* value) = 0;

  // Carrier bundle links; fields of 1024 bytes.
  virtual KernelReturn server_BVMobileHelperReplaceCarrierSymlink(PortName port, char* target, char* linkPath,
                                                                  char* domain) = 0;
  virtual KernelReturn server_BVMobileHelperCreateSymlink(PortName port, char* target, char* linkPath) = 0;
  virtual KernelReturn server_BVMobileHelperRemoveCarrierFile(PortName port, char* path, char* domain) = 0;

  virtual KernelReturn server_BVMobileHelperIsVoicemailServiceSubscribed(PortName port,
                                                                         std::uint8_t* subscribed) = 0;
  virtual KernelReturn server_BVMobileHelperCellularHeartbeat(PortName port, std::int32_t value) = 0;
  virtual KernelReturn server_BVMobileHelperCheckLASDUpdate(PortName port, std::int32_t mask) = 0;

  // Carrier bundle files; fields of 256 bytes.
  virtual KernelReturn server_BVMobileHelperCopyCarrierFile(PortName port, char* sourceDirectory,
                                                            char* destinationDirectory, char* fileName,
                                                            std::uint8_t* success) = 0;
  virtual KernelReturn server_BVMobileHelperCopyCrashLogs(PortName port, char* path,
                                                          std::uint8_t* success) = 0;
  virtual KernelReturn server_BVMobileHelperMoveIntoCarrierBundles(PortName port, char* sourcePath,
                                                                   char* destinationDirectory, char* name,
                                                                   std::uint8_t* success) = 0;

  // Location; degrees.
  virtual KernelReturn server_BVMobileHelperRequestCountryCodeFromLocation(PortName port, double latitude,
                                                                           double longitude) = 0;
  virtual KernelReturn server_BVMobileHelperCopyCountryCode(PortName port, char* code /* 64 bytes */) = 0;
  virtual KernelReturn server_BVMobileHelperRequestWanIPFromLocation(PortName port) = 0;

  virtual KernelReturn server_BVMobileHelperEnableRadioManagerLogs(PortName port, std::int32_t enable) = 0;

  // Fields of 256 bytes.
  virtual KernelReturn server_BVMobileHelperUnpackArchive(PortName port, char* archivePath,
                                                          char* destinationPath, std::uint8_t* success) = 0;
  virtual KernelReturn server_BVMobileHelperLoadPlistFile(PortName port, char* path,
                                                          OutOfLinePayload* contents) = 0;

  // Labels.
  virtual KernelReturn server_BVMobileHelperCopyBadgeLabels(PortName port, const void* labels,
                                                            std::uint32_t labelsLength, const void* languages,
                                                            std::uint32_t languagesLength,
                                                            OutOfLinePayload* badges) = 0;
  virtual KernelReturn server_BVMobileHelperCopyLocalizedLabels(PortName port, const void* labels,
                                                                std::uint32_t labelsLength,
                                                                const void* languages,
                                                                std::uint32_t languagesLength,
                                                                OutOfLinePayload* texts) = 0;

  // Contacts; fields of 64 bytes.
  virtual KernelReturn server_BVMobileHelperRemapContactsChannel(PortName port, char* from, char* to,
                                                                 std::uint8_t* success) = 0;
};

}  // namespace brenvik
