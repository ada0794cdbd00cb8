// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/lasd/DatabaseInstaller.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>

#include "helper/lasd/DatabaseTypes.h"
#include "platform/base/UniqueFd.h"
#include "platform/log/Log.h"

namespace brenvik {
namespace {

constexpr mode_t kDirectoryMode = 0755;

UniqueFd openDirectory(const std::string& path, int flags = 0) {
  return UniqueFd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC | flags));
}

// So that a power cut cannot undo the rename after the record of it was stored.
void syncDirectory(const std::string& path) {
  const UniqueFd directory = openDirectory(path);
  if (directory.isValid())
    (void)::fsync(directory.get());  // not every file system can, and the name is there
}

}  // namespace

std::string databaseFileName(const std::string& url) {
  const auto slash = url.rfind('/');
  if (slash == std::string::npos) return {};
  std::string name = url.substr(slash + 1);
  name.resize(std::min(name.size(), name.find(".gz")));
  if (name == "." || name == "..") return {};
  return name;
}

bool DatabaseInstaller::makeDirectory() {
  const char* const path = parts_.directory.c_str();
  struct stat status {};
  if (::stat(path, &status) == 0 ? S_ISDIR(status.st_mode) : errno != ENOENT) return true;
  if (::mkdir(path, kDirectoryMode) != 0) {
    logUnified(LogLevel::error, "Cannot create %s errno set to %s", path, std::strerror(errno));
    return false;
  }
  // Whatever the umask took away; without it the folder still serves us. Not by its name: the folder above is
  // another account's, which could put a link to anything there.
  if (const UniqueFd made = openDirectory(parts_.directory, O_NOFOLLOW); made.isValid())
    (void)::fchmod(made.get(), kDirectoryMode);
  // Or a power cut could take the folder with the database in it, and leave the record of it.
  syncDirectory(std::filesystem::path(parts_.directory).parent_path().string());
  return true;
}

bool DatabaseInstaller::downloadAndInstall(const std::string& url, std::int32_t type,
                                           const PropertyList& record) {
  if (!makeDirectory()) return false;

  HttpFetcher fetcher(parts_.fetcher);
  if (!fetcher.fetch(url, WifiOnly::yes)) {
    logUnified(LogLevel::error, "Cannot download file %s. Either Wifi is turned OFF or not Wifi attached",
               url.c_str());
    return false;
  }

  const std::string name = databaseFileName(url);
  if (name.empty()) {
    logUnified(LogLevel::error, "No file name in URL %s", url.c_str());
    return false;
  }
  const std::string finalPath = parts_.directory + "/" + name;
  const std::string temporaryPath = finalPath + ".tmp";

  logUnified(LogLevel::info, "uncompressing to %s", temporaryPath.c_str());
  if (!fetcher.uncompressTo(temporaryPath)) {
    logUnified(LogLevel::error, "Failed to commit the data to file for %s", temporaryPath.c_str());
    return false;
  }

  struct stat status {};
  if (::stat(finalPath.c_str(), &status) == 0) {
    if (::remove(finalPath.c_str()) != 0) {
      logUnified(LogLevel::error, "Failed to remove the previous download at location %s", finalPath.c_str());
      return false;
    }
    logUnified(LogLevel::info, "Removed old database %s", finalPath.c_str());
  }
  logUnified(LogLevel::info, "Moving %s to %s", temporaryPath.c_str(), finalPath.c_str());
  if (::rename(temporaryPath.c_str(), finalPath.c_str()) != 0) {
    logUnified(LogLevel::error, "Could not rename %s to %s: %s", temporaryPath.c_str(), finalPath.c_str(),
               std::strerror(errno));
    return false;
  }
  syncDirectory(parts_.directory);

  // Before the record, and not after it: a lack of memory must not make a failure of what has been done.
  const PropertyList version = record.find(kVersionKey);
  const std::string versionText(version.asString().value_or("(null)"));
  if (!recordVersion(type, record)) return false;
  logUnified(LogLevel::info, "Downloaded %s database version %s successfully", nameOfDatabaseType(type),
             versionText.c_str());
  return true;
}

bool DatabaseInstaller::recordVersion(std::int32_t type, const PropertyList& record) {
  const char* const key = keyOfDatabaseType(type);
  if (key == nullptr) return false;
  try {
    parts_.preferences.setValue(key, record, kVersionsDomain, UserScope::currentUser, HostScope::anyHost);
    return parts_.preferences.synchronize(kVersionsDomain, UserScope::currentUser, HostScope::anyHost);
  } catch (const std::bad_alloc&) {
    return false;  // the store has logged it
  }
}

}  // namespace brenvik
