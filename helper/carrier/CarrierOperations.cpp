// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/carrier/CarrierOperations.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <exception>
#include <string>

#include "platform/base/UniqueFd.h"
#include "platform/base/Utf8.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

constexpr mode_t kBundlesDirectoryMode = 0755;
constexpr const char* kCrashLogs = "Library/Logs/CrashReporter/";

void terminate(char* field, std::size_t size) { field[size - 1] = '\0'; }

// The routines' own boundary: nothing is thrown past it.
template <typename Work>
KernelReturn guarded(KernelReturn onException, Work work) noexcept {
  try {
    return work();
  } catch (const std::exception&) {
    return onException;
  }
}

// What stands at a path, links not followed. Holds it, so that nothing new is taken for it: the number of an
// item that is gone may be given to another.
class StandingItem {
 public:
  explicit StandingItem(const std::string& path)
      : fd_(::open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC)),
        isThere_(fd_.isValid() && ::fstat(fd_.get(), &info_) == 0),
        isKnown_(isThere_ || errno == ENOENT || errno == ENOTDIR) {}

  // Whether the same item stands at the path, or nothing does, as when this object was made; or that cannot
  // be told, for want of a descriptor then.
  bool standsAt(const std::string& path) const {
    if (!isKnown_) return true;
    struct stat now {};
    if (::lstat(path.c_str(), &now) != 0) return !isThere_;
    return isThere_ && now.st_dev == info_.st_dev && now.st_ino == info_.st_ino;
  }

 private:
  const UniqueFd fd_;
  struct stat info_ {};
  const bool isThere_;
  const bool isKnown_;
};

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
    const std::string source = std::string(sourceDirectory) + "/" + fileName;
    // Onto a directory the file is copied into it.
    const std::string copied = fileSystem && fileSystem->isDirectory(destination)
                                   ? destination + "/" + fileSystem->baseName(source)
                                   : destination;
    const StandingItem before(copied);
    if (fileSystem &&
        fileSystem->copyFileIntoDirectory(sourceDirectory, destinationDirectory, fileName) == 0) {
      // The copy of a file onto another reports no failure: only a new file at the place tells that it was
      // made.
      if (!fileSystem->isDirectory(source) && before.standsAt(copied)) return kern::success;
      const MobileAccount account = account_();
      // A link was copied as a link, and is given away as one: what it points to is not ours to give.
      *success = fileSystem->giveItem(destination, account.uid, account.gid) == 0 &&
                 fileSystem->syncItem(destination) == 0;
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
