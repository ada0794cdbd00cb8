// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <functional>
#include <list>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/preferences/PreferencesStore.h"

namespace brenvik {

struct DomainPlace;

// Preferences in files: one binary property list for each domain (XML is read as well). It writes a temporary
// file, syncs it, renames it and syncs the folder, under a lock that all writers of a folder share.
//
//   current user, any host      <home>/Library/Preferences/<domain>.plist
//   current user, current host  <home>/Library/Preferences/ByHost/<domain>.<machine id>.plist
//   any user, any host          <any user>/<domain>.plist
//   any user, current host      <any user>/ByHost/<domain>.<machine id>.plist
//
// Only the keys that were set are written; other keys that others have changed meanwhile stay. A file that is
// damaged or cannot be read is renamed within its folder and logged, never overwritten.
//
// Any thread; one thread at a time uses a domain, and synchronize() keeps it for as long as the disk takes.
class FilePreferences final : public PreferencesStore {
 public:
  struct Places {
    std::string home;       // of the user whose preferences these are; empty: none is known
    std::string anyUser;    // absolute
    std::string machineId;  // empty: unknown, so nothing can be kept for the current host
    int homeError = 0;      // errno of a look-up that failed; 0: there is none
    int machineIdError = 0;
  };
  // The effective user's home directory, the folder compiled in, and /etc/machine-id. Throws std::bad_alloc.
  static Places systemPlaces();

  // How long a writer waits for other writers in the same folder.
  static constexpr std::chrono::milliseconds kPatience{1000};

  // `places` is called when the first domain is used, and again for each operation that needs an unknown
  // place, because a look-up may fail at one moment and succeed later.
  explicit FilePreferences(std::function<Places()> places = systemPlaces,
                           std::chrono::milliseconds patience = kPatience);
  FilePreferences(const FilePreferences&) = delete;
  FilePreferences& operator=(const FilePreferences&) = delete;
  ~FilePreferences() override;

  void setValue(std::string_view key, const PropertyList& value, std::string_view domain, UserScope user,
                HostScope host) override;
  bool synchronize(std::string_view domain, UserScope user, HostScope host) override;
  PropertyList copyValue(std::string_view key, std::string_view domain, UserScope user,
                         HostScope host) override;
  bool synchronizeApplication(std::string_view domain) override;
  PropertyList copyApplicationValue(std::string_view key, std::string_view domain) override;
  void flushCachesForAnyUser(const std::string* domain) noexcept override;

 private:
  class Domain;

  void lookUpPlaces(UserScope user, HostScope host);
  std::optional<DomainPlace> placeOf(std::string_view domain, UserScope user, HostScope host);
  void logNothingStored(std::string_view domain, UserScope user, HostScope host);
  // Returns null if the domain does not name a file there. May throw std::bad_alloc, but not for a domain
  // already in the list, so that its changes can always be stored or dropped.
  std::shared_ptr<Domain> find(std::string_view domain, UserScope user, HostScope host);

  const std::function<Places()> askForPlaces_;
  const std::chrono::milliseconds patience_;
  std::mutex mutex_;                            // of what follows; never held while a domain works
  std::optional<Places> places_;                // what is known of them
  std::list<std::shared_ptr<Domain>> domains_;  // last used first
};

}  // namespace brenvik
