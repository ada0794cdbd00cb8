// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>

#include "helper/carrier/FileSystemInterface.h"
#include "helper/carrier/MobileAccount.h"
#include "helper/carrier/PathPolicy.h"
#include "interface/Wire.h"
#include "platform/files/ArchiveCopier.h"
#include "platform/preferences/PreferencesStore.h"

namespace brenvik {

// The requests that install, link, move, unpack and remove carrier configurations. Main thread only; each
// call does its file work before it returns. Text arguments are fields of the request, of the sizes below;
// their last byte is overwritten with a NUL. The port is not used. Nothing throws.
//
// The link and removal requests report their result as the status (5: a system call failed, 8: the path is
// not allowed). The others always return 0, and report it in the success byte (1 or 0) and in the log.
class CarrierOperations {
 public:
  static constexpr std::size_t kLongField = 1024;
  static constexpr std::size_t kShortField = 256;

  // References must outlive the object.
  CarrierOperations(FileSystemFactory fileSystems, ArchiveCopierFactory archiveCopiers, PathPolicy& policy,
                    PreferencesStore& preferences, MobileAccountSource account)
      : fileSystems_(std::move(fileSystems)),
        archiveCopiers_(std::move(archiveCopiers)),
        policy_(policy),
        preferences_(preferences),
        account_(std::move(account)) {}

  // Long fields. Replaces any item at the link path but a directory that is not empty. Refuses no path.
  KernelReturn createSymlink(PortName port, char* target, char* linkPath) noexcept;
  // Long fields. Only for a listed carrier path. On success it drops the cached preferences of the domain,
  // unless that text is empty.
  KernelReturn replaceCarrierSymlink(PortName port, char* target, char* linkPath, char* domain) noexcept;
  // Long fields. Drops the cached preferences of the domain first, even if the path is then refused.
  KernelReturn removeCarrierFile(PortName port, char* path, char* domain) noexcept;

  // Short fields. Copies one file into an allowed directory and gives it to the mobile account.
  KernelReturn copyCarrierFile(PortName port, char* sourceDirectory, char* destinationDirectory,
                               char* fileName, std::uint8_t* success) noexcept;
  // Short field. Copies a directory into the mobile account's crash logs. `success` may be null.
  KernelReturn copyCrashLogs(PortName port, char* sourcePath, std::uint8_t* success) noexcept;
  // Short fields. The destination directory is made before its path is judged. `success` may be null.
  KernelReturn moveIntoCarrierBundles(PortName port, char* sourcePath, char* destinationDirectory, char* name,
                                      std::uint8_t* success) noexcept;
  // Short fields. Writes `success` only to set it to true; the caller must initialise it to false.
  KernelReturn unpackArchive(PortName port, char* archivePath, char* destinationPath,
                             std::uint8_t* success) noexcept;

 private:
  KernelReturn placeLink(const char* target, const char* linkPath);
  void flushDomain(const char* domain);

  const FileSystemFactory fileSystems_;
  const ArchiveCopierFactory archiveCopiers_;
  PathPolicy& policy_;
  PreferencesStore& preferences_;
  const MobileAccountSource account_;
};

}  // namespace brenvik
