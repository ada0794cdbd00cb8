// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "Helper/Shared/Server/BusyTokens.h"
#include "helper/lasd/DatabaseInstaller.h"
#include "helper/lasd/DatabaseTypes.h"
#include "helper/lasd/HttpFetcher.h"
#include "helper/lasd/Notifications.h"
#include "platform/base/Clock.h"
#include "platform/messageport/MessagePort.h"
#include "platform/plist/PropertyList.h"
#include "platform/preferences/PreferencesStore.h"
#include "platform/runloop/WorkQueue.h"

namespace brenvik {

// What a manifest may have at most; one of five entries has a kilobyte or two.
inline constexpr std::uint64_t kLargestManifest = std::uint64_t{16} << 20;

// Where the compiled-in update server keeps the manifest.
extern const char* const kManifestUrl;

// Keeps the location-aware service databases up to date: compares the versions recorded here with the update
// server's manifest, has every database installed that differs, and tells the telephony daemon what came of
// it. Checks are made one after the other on a queue of its own. Owned by shared_ptr only.
class LASDUpdater : public std::enable_shared_from_this<LASDUpdater> {
 public:
  // What it works with; all of it outlives the updater, or its shutDown().
  struct Parts {
    WorkQueues& queues;
    WebClient& web;
    Gunzip& gunzip;
    PreferencesStore& preferences;
    MessagePorts& messagePorts;
    std::string manifestUrl = kManifestUrl;
    std::string directory = kDatabaseDirectory;
    std::function<DiskSpace(int file)> diskSpace = diskSpaceOf;
    std::function<std::chrono::nanoseconds()> now = timeSinceBoot;
  };
  enum class VersionSource { preferences, manifest };
  // What loadVersions() returns when the manifest could not be fetched. Types are the bits 1 to 16, so this
  // is never a mask of them.
  static constexpr std::int64_t kNotFetched = 0xFFFFFFFF;

  LASDUpdater() noexcept = default;
  LASDUpdater(const LASDUpdater&) = delete;
  LASDUpdater& operator=(const LASDUpdater&) = delete;
  ~LASDUpdater();

  // The process's own, made before main() begins. It costs nothing until the first check.
  static const std::shared_ptr<LASDUpdater>& shared() noexcept;

  // To be called once, before anything else.
  void configure(const Parts& parts);

  // Starts a check of the types in the mask and returns at once; other bits are ignored. Holds a busy token
  // until the check's last notification is sent. A type for which memory runs out has failed, and the next
  // one has its turn. Main loop only; the server outlives the check. Ends the process when the updater is on
  // its way out.
  void checkForUpdate(ServerContext& server, std::uint32_t mask);

  // How the last check of a type went, or that it is under way; by the clock of Parts.
  struct LastCheck {
    enum class Outcome : std::uint8_t { checking, updated, noUpdateRequired, failed };
    std::int32_t type = 0;
    Outcome outcome = Outcome::checking;
    std::chrono::nanoseconds when{0};
  };
  // Of the types that were checked in this process. Any thread. Throws std::bad_alloc.
  std::vector<LastCheck> lastChecks() const;

  // Ends the queue after the check that runs, which may wait for the HTTP client. Main loop only.
  void shutDown() noexcept;

  // ---- on the queue, or with none running ----

  // Reads the version records of the types in the mask; bits that are no type are ignored.
  //
  // VersionSource::preferences: `source` is the preferences domain. Each type gets its record, or none
  // when there is no dictionary; earlier entries of these types go. Always returns 0.
  //
  // VersionSource::manifest: `source` is the manifest's URL. Blocks until the HTTP client is done. Returns
  // kNotFetched when the manifest could not be fetched. Returns 0 when no type needs an update; a manifest
  // that is no dictionary is logged and counts as that. Else returns the mask of the types that need an
  // update; their entries are the server's then. A type for which memory does not suffice is left out of the
  // mask and noted by itself. Throws std::bad_alloc when memory does not suffice for the manifest.
  std::int64_t loadVersions(const std::string& source, VersionSource kind, std::uint32_t mask);
  // The second half of the above: returns the mask of the types whose entry in the manifest is new, and keeps
  // copies of these entries; nothing of the manifest itself is kept.
  std::int64_t compareWithManifest(const PropertyList& manifest, std::uint32_t mask);
  // False when the type's version in the manifest differs from the recorded one, or either is missing. Says
  // in the log why. Throws std::bad_alloc.
  bool isUpToDate(const PropertyList& manifest, std::int32_t type);
  // Has the type's database installed and sends the telephony daemon the outcome. Blocks until the download
  // is done. Throws std::bad_alloc before the download begins.
  void updateDatabase(std::int32_t type);

 private:
  void check(ServerContext& server, std::uint32_t mask);
  // Drops what cannot be sent.
  void tell(NotificationKind kind, std::int32_t type) noexcept;
  // Of the types in the mask. A type that stays at `checking` has failed when the check ends.
  void note(std::uint32_t mask, LastCheck::Outcome outcome) noexcept;
  void noteEnd() noexcept;

  std::unique_ptr<Parts> parts_;
  std::function<std::chrono::nanoseconds()> now_ = timeSinceBoot;
  // By type, the record found here or, once it needs an update, the server's; none when there is no record.
  std::map<std::int32_t, PropertyList> versions_;  // on the queue only
  // The types of the present check for which memory did not suffice.
  std::int64_t outOfMemory_ = 0;  // on the queue only
  mutable std::mutex checksMutex_;
  std::array<LastCheck, kDatabaseTypesInOrder.size()> lastChecks_;  // with checksMutex_; type 0: none yet
  // Last, so that it ends first: its tasks use everything above.
  std::shared_ptr<WorkQueue> queue_;
};

}  // namespace brenvik
