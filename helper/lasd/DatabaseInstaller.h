// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstdint>
#include <string>

#include "helper/lasd/HttpFetcher.h"
#include "platform/plist/PropertyList.h"
#include "platform/preferences/PreferencesStore.h"

namespace brenvik {

inline constexpr const char kDatabaseDirectory[] = "/var/mobile/Library/LASD";

// Puts one database in place and records its version. Blocks while it downloads; one thread at a time.
class DatabaseInstaller {
 public:
  // What it works with; all of it outlives the installer.
  struct Parts {
    HttpFetcher::Parts fetcher;
    PreferencesStore& preferences;
    std::string directory = kDatabaseDirectory;
  };

  explicit DatabaseInstaller(Parts parts) : parts_(std::move(parts)) {}

  // Downloads the gzip file, never over cellular, puts it uncompressed in place of an older one, and then
  // stores `record` as the type's version record. True when both are done. A failure on the way leaves the
  // older record, so that the next check tries again, unless the server has gone back to that version by
  // then. The previous file is removed before the new one is moved in, so that for a moment there is none.
  bool downloadAndInstall(const std::string& url, std::int32_t type, const PropertyList& record);

 private:
  bool makeDirectory();
  bool recordVersion(std::int32_t type, const PropertyList& record);
  const Parts parts_;
};

// The name of the file that a URL's database is kept in: what follows the last '/', up to the first ".gz".
// Empty when that names no file.
std::string databaseFileName(const std::string& url);

}  // namespace brenvik
