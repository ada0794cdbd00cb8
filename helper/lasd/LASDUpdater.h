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

// The largest manifest, in bytes; one of five entries has a kilobyte or two.
inline constexpr std::uint64_t kLargestManifest = std::uint64_t{16} << 20;

// The manifest's URL on the compiled-in update server.
extern const char* const kManifestUrl;

// Keeps the location-aware service databases up to date: compares the versions recorded here with the update
// server's manifest, installs every database that differs, and tells the telephony daemon the results. Checks
// run one after the other on the updater's own queue. Owned by shared_ptr only.
class LASDUpdater : public std::enable_shared_from_this<LASDUpdater> {
 public:
  // The updater's dependencies, which must outlive it or its shutDown().
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

  // The process's own updater, made before main() begins. It costs nothing until the first check.
  static const std::shared_ptr<LASDUpdater>& shared() noexcept;

  // Call it once, before anything else.
  void configure(const Parts& parts);

  // Starts a check of the types in the mask and returns at once; other bits are ignored. Holds a busy token
  // until the check's last notification is sent. If memory runs out for a type, that type fails and the check
  // goes on with the next. Main loop only; the server must outlive the check. If the updater is being
  // destroyed, the process ends.
  void checkForUpdate(ServerContext& server, std::uint32_t mask);

  // The result of the last check of a type, or that a check is under way. Times are from the clock of Parts.
  struct LastCheck {
    enum class Outcome : std::uint8_t { checking, updated, noUpdateRequired, failed };
    std::int32_t type = 0;
    Outcome outcome = Outcome::checking;
    std::chrono::nanoseconds when{0};
  };
  // Returns the types that were checked in this process. Any thread. Throws std::bad_alloc.
  std::vector<LastCheck> lastChecks() const;

  // Waits for the check that is running, which may wait for the HTTP client, and ends the queue. Main loop
  // only.
  void shutDown() noexcept;

  // ---- on the queue, or with none running ----

  // Reads the version records of the types in the mask; other bits are ignored.
  //
  // VersionSource::preferences: `source` is the preferences domain. Each type gets its record, or none if
  // there is no dictionary; earlier entries of these types are dropped. Always returns 0.
  //
  // VersionSource::manifest: `source` is the manifest's URL. Blocks until the HTTP client is done. Returns
  // kNotFetched if the manifest could not be fetched; 0 if no type needs an update, or if the manifest is not
  // a dictionary (which is logged); else the mask of the types that need an update, whose entries are then
  // the server's. A type for which memory runs out is left out of the mask and recorded separately. Throws
  // std::bad_alloc if memory does not suffice for the manifest.
  std::int64_t loadVersions(const std::string& source, VersionSource kind, std::uint32_t mask);
  // The second half of loadVersions() for a manifest: returns the mask of the types whose entry in the
  // manifest is new, and keeps copies of these entries. The manifest itself is not kept.
  std::int64_t compareWithManifest(const PropertyList& manifest, std::uint32_t mask);
  // Returns false if the type's version in the manifest differs from the recorded one, or either is missing.
  // Logs the reason. Throws std::bad_alloc.
  bool isUpToDate(const PropertyList& manifest, std::int32_t type);
  // Installs the type's database and sends the telephony daemon the outcome. Blocks until the download is
  // done. May throw std::bad_alloc, but only before the download begins.
  void updateDatabase(std::int32_t type);

 private:
  void check(ServerContext& server, std::uint32_t mask);
  // Sends a notification; drops it if it cannot be sent.
  void tell(NotificationKind kind, std::int32_t type) noexcept;
  // Records the outcome for the types in the mask. A type still at `checking` when the check ends has failed.
  void note(std::uint32_t mask, LastCheck::Outcome outcome) noexcept;
  void noteEnd() noexcept;

  std::unique_ptr<Parts> parts_;
  std::function<std::chrono::nanoseconds()> now_ = timeSinceBoot;
  // The record of each type: the one found here or, once the type needs an update, the server's; none if
  // there is no record.
  std::map<std::int32_t, PropertyList> versions_;  // on the queue only
  // The types of the present check for which memory ran out.
  std::int64_t outOfMemory_ = 0;  // on the queue only
  mutable std::mutex checksMutex_;
  std::array<LastCheck, kDatabaseTypesInOrder.size()> lastChecks_;  // with checksMutex_; type 0: none yet
  // Declared last, so that it is destroyed first: its tasks use everything above.
  std::shared_ptr<WorkQueue> queue_;
};

}  // namespace brenvik
