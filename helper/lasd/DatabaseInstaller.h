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

// Downloads and installs one database and records its version. Blocks while it downloads; one thread at a
// time.
class DatabaseInstaller {
 public:
  // The installer's dependencies, which must outlive it.
  struct Parts {
    HttpFetcher::Parts fetcher;
    PreferencesStore& preferences;
    std::string directory = kDatabaseDirectory;
  };

  explicit DatabaseInstaller(Parts parts) : parts_(std::move(parts)) {}

  // Downloads the gzip file, never over cellular, replaces the older database with its contents, and then
  // stores `record` as the type's version record. Returns true if both are done. After a failure the old
  // record stays, so the next check tries again (unless the server has gone back to that version). The old
  // file is removed before the new one is moved in, so for a moment there is none.
  bool downloadAndInstall(const std::string& url, std::int32_t type, const PropertyList& record);

 private:
  bool makeDirectory();
  bool recordVersion(std::int32_t type, const PropertyList& record);
  const Parts parts_;
};

// Returns the file name for a URL's database: the text after the last '/', up to the first ".gz". Empty if
// that is not a file name.
std::string databaseFileName(const std::string& url);

}  // namespace brenvik
