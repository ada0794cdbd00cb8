// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/carrier/CarrierOperations.h"

#include <cerrno>
#include <string>

#include "platform/base/Guarded.h"
#include "platform/base/Utf8.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

constexpr mode_t kBundlesDirectoryMode = 0755;
constexpr const char* kCrashLogs = "Library/Logs/CrashReporter/";

void terminate(char* field, std::size_t size) { field[size - 1] = '\0'; }

}  // namespace

KernelReturn CarrierOperations::placeLink(const char* target, const char* linkPath) {
  const std::unique_ptr<FileSystemInterface> fileSystem = fileSystems_();
  return fileSystem && fileSystem->placeLink(linkPath, target) == 0 ? kern::success : kern::failure;
}

void CarrierOperations::flushDomain(const char* domain) {
  if (!isValidUtf8(domain)) {
    preferences_.flushCachesForAnyUser(nullptr);
    return;
  }
  const std::string text = domain;
  preferences_.flushCachesForAnyUser(&text);
}

KernelReturn CarrierOperations::createSymlink(PortName, char* target, char* linkPath) noexcept {
  return guarded(kern::failure, [&] {
    terminate(target, kLongField);
    terminate(linkPath, kLongField);
    return placeLink(target, linkPath);
  });
}

KernelReturn CarrierOperations::replaceCarrierSymlink(PortName, char* target, char* linkPath,
                                                      char* domain) noexcept {
  return guarded(kern::failure, [&] {
    terminate(target, kLongField);
    terminate(linkPath, kLongField);
    terminate(domain, kLongField);
    if (!policy_.isListedCarrierPath(linkPath)) {
      logUnified(LogLevel::error, "Cannot remove symlink: %s", linkPath);
      return kern::noAccess;
    }
    if (const KernelReturn failed = placeLink(target, linkPath); failed != kern::success) return failed;
    logUnified(LogLevel::info, "linkpath: %s, domain: %s", linkPath, domain);
    if (domain[0] != '\0') flushDomain(domain);
    return kern::success;
  });
}

KernelReturn CarrierOperations::removeCarrierFile(PortName, char* path, char* domain) noexcept {
  return guarded(kern::failure, [&] {
    terminate(path, kLongField);
    terminate(domain, kLongField);
    if (domain[0] != '\0') {
      logBsd(SyslogPriority::notice, "Removing domain: %s\n", domain);
      flushDomain(domain);
    }
    if (!policy_.isAllowedCarrierPath(path)) return kern::noAccess;
    const std::unique_ptr<FileSystemInterface> fileSystem = fileSystems_();
    return fileSystem && fileSystem->removeEntry(path) == 0 ? kern::success : kern::failure;
  });
}

KernelReturn CarrierOperations::copyCarrierFile(PortName, char* sourceDirectory, char* destinationDirectory,
                                                char* fileName, std::uint8_t* success) noexcept {
  return guarded(kern::success, [&] {
    terminate(sourceDirectory, kShortField);
    terminate(destinationDirectory, kShortField);
    terminate(fileName, kShortField);
    *success = 0;
    const std::string destination = std::string(destinationDirectory) + "/" + fileName;
    logBsd(SyslogPriority::notice, "'%s', '%s', '%s'\n", sourceDirectory, destinationDirectory, fileName);
    if (!policy_.isAllowedCarrierPath(destination.c_str())) {
      logBsd(SyslogPriority::error, "Destination directory %s is not within the allowed directories\n",
             destination.c_str());
      return kern::success;
    }
    const std::unique_ptr<FileSystemInterface> fileSystem = fileSystems_();
    const MobileAccount account = account_();
    bool isGiven = false;
    // A copied link is given away as a link: what it points to is not ours to give.
    if (fileSystem && fileSystem->copyFileAndGive(sourceDirectory, destinationDirectory, fileName,
                                                  account.uid, account.gid, &isGiven) == 0) {
      *success = isGiven;
    } else {
      logBsd(SyslogPriority::error, "Failed to copy the file %s to %s\n", sourceDirectory,
             destinationDirectory);
    }
    return kern::success;
  });
}

KernelReturn CarrierOperations::copyCrashLogs(PortName, char* sourcePath, std::uint8_t* success) noexcept {
  return guarded(kern::success, [&] {
    if (success != nullptr) *success = 0;
    const MobileAccount account = account_();
    std::string destination;  // without a home there is none, and the copy fails
    if (account.home != nullptr && account.home[0] != '\0') {
      destination = account.home;
      if (!destination.ends_with('/')) destination += '/';
      destination += kCrashLogs;
    }
    terminate(sourcePath, kShortField);
    logBsd(SyslogPriority::notice, "'%s', '%s'\n", sourcePath, destination.c_str());
    const std::unique_ptr<FileSystemInterface> fileSystem = fileSystems_();
    const int result = fileSystem ? fileSystem->copyItem(sourcePath, destination) : ENOMEM;
    if (result != 0) {
      logBsd(SyslogPriority::notice, "Failed to copy the directory %s to %s. Error: %d\n", sourcePath,
             destination.c_str(), result);
    }
    if (success != nullptr) *success = result == 0;
    return kern::success;
  });
}

KernelReturn CarrierOperations::moveIntoCarrierBundles(PortName, char* sourcePath, char* destinationDirectory,
                                                       char* name, std::uint8_t* success) noexcept {
  return guarded(kern::success, [&] {
    if (success != nullptr) *success = 0;
    terminate(sourcePath, kShortField);
    terminate(destinationDirectory, kShortField);
    terminate(name, kShortField);
    logBsd(SyslogPriority::notice, "'%s', '%s'\n", sourcePath, destinationDirectory);
    const std::unique_ptr<FileSystemInterface> fileSystem = fileSystems_();
    if (!fileSystem) return kern::success;
    if (!fileSystem->itemExists(destinationDirectory)) {
      const int code = fileSystem->createDirectory(destinationDirectory, kBundlesDirectoryMode, true);
      if (code != 0) {
        logBsd(SyslogPriority::notice, "Failed to create CarrierBundles Dir  to %s. Error: %d\n",
               destinationDirectory, code);
        return kern::success;
      }
    }
    const std::string destination = std::string(destinationDirectory) + "/" + name;
    logBsd(SyslogPriority::notice, "'%s', '%s', '%s'\n", sourcePath, destinationDirectory, name);
    if (!policy_.isAllowedCarrierPath(destination.c_str())) {
      logBsd(SyslogPriority::error, "Destination directory %s is not within the allowed directories\n",
             destination.c_str());
      return kern::success;
    }
    const int code = fileSystem->moveDirectory(sourcePath, destination);
    if (code == 0) {
      if (success != nullptr) *success = 1;
    } else {
      logBsd(SyslogPriority::error, "Failed to move the directory %s to %s. Error: %d\n", sourcePath,
             destinationDirectory, code);
    }
    return kern::success;
  });
}

KernelReturn CarrierOperations::unpackArchive(PortName, char* archivePath, char* destinationPath,
                                              std::uint8_t* success) noexcept {
  return guarded(kern::success, [&] {
    terminate(archivePath, kShortField);
    terminate(destinationPath, kShortField);
    const std::unique_ptr<ArchiveCopier> copier = archiveCopiers_();
    if (!copier) return kern::success;
    const PropertyList options =
        PropertyList::dictionary({{"extractPKZip", PropertyList::boolean(true)},
                                  {"copyExtendedAttributes", PropertyList::boolean(true)},
                                  {"copyResources", PropertyList::boolean(true)}});
    // An archive with one entry that cannot be unpacked is not unpacked in part.
    copier->setFileErrorHandler([](const ArchiveFileError&) { return archive_answer::stopCopy; });
    copier->setFatalErrorHandler(
        [](int) { logBsd(SyslogPriority::error, "ArkCopier signaled fatal file error"); });
    if (copier->copy(archivePath, destinationPath, options) == 0) *success = 1;
    return kern::success;
  });
}

}  // namespace brenvik
