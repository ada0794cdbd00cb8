// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/lasd/LASDUpdater.h"

#include <exception>
#include <new>
#include <span>
#include <string_view>
#include <utility>

#include "helper/lasd/DatabaseTypes.h"
#include "helper/lasd/VersionText.h"
#include "interface/status/Status.h"
#include "platform/log/Log.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

constexpr const char kQueueLabel[] = "LASDUpdater";

// Made with the other statics, let go of at exit.
const std::shared_ptr<LASDUpdater> sharedUpdater = std::make_shared<LASDUpdater>();

PropertyList onlyDictionary(PropertyList value) {
  return value && value.is(PropertyList::Type::dictionary) ? std::move(value) : PropertyList();
}

PropertyList onlyString(PropertyList value) {
  return value && value.is(PropertyList::Type::string) ? std::move(value) : PropertyList();
}

std::string_view textOf(const PropertyList& string) { return string.asString().value_or(std::string_view()); }

// A token of the server, given back at the end of the scope, however that is left.
class HeldToken {
 public:
  HeldToken(ServerContext& server, std::uint32_t token) noexcept : server_(server), token_(token) {}
  explicit HeldToken(ServerContext& server)
      : HeldToken(server, AcquireBusyToken(server, StatusReport::kDatabaseCheck)) {}
  HeldToken(const HeldToken&) = delete;
  HeldToken& operator=(const HeldToken&) = delete;
  ~HeldToken() { (void)ReleaseBusyToken(server_, token_); }  // one bit, as it was given

 private:
  ServerContext& server_;
  const std::uint32_t token_;
};

// A value taken out of a document keeps all of that document; this one has its own memory.
PropertyList ownCopy(const PropertyList& value) {
  const auto bytes = serializePropertyList(value, PropertyListFormat::binary);
  return bytes ? parsePropertyList(std::as_bytes(std::span(*bytes))) : value;
}

void giveUp(std::int32_t type) noexcept {
  logUnified(LogLevel::error, "Update of the %s database given up: out of memory", nameOfDatabaseType(type));
}

// For a log line.
std::string shown(const PropertyList& string) {
  return std::string(string ? textOf(string) : std::string_view("(null)"));
}

}  // namespace

const char* const kManifestUrl = "https://" BRENVIK_LASD_HOST "/1/v3/lasd.plist";

const std::shared_ptr<LASDUpdater>& LASDUpdater::shared() noexcept { return sharedUpdater; }

LASDUpdater::~LASDUpdater() = default;

void LASDUpdater::configure(const Parts& parts) {
  parts_ = std::make_unique<Parts>(parts);
  now_ = parts.now;
}

void LASDUpdater::shutDown() noexcept { queue_.reset(); }

void LASDUpdater::checkForUpdate(ServerContext& server, std::uint32_t mask) {
  logUnified(LogLevel::info, "Trying to see if update available for mask %x", mask);
  const std::uint32_t token = AcquireBusyToken(server, StatusReport::kDatabaseCheck);
  const std::weak_ptr<LASDUpdater> weak = weak_from_this();
  auto self = weak.lock();
  if (self == nullptr) std::terminate();
  try {
    // Made here and not before, so that a process which never needs it does not pay for it.
    if (queue_ == nullptr) queue_ = parts_->queues.makeSerial(kQueueLabel, QualityOfService::standard);
    queue_->post([self = std::move(self), &server, mask, token] {
      const HeldToken held(server, token);
      try {
        self->check(server, mask);
      } catch (...) {  // what is called here throws for no other reason
        logUnified(LogLevel::error, "Update check given up: out of memory");
        self->tell(NotificationKind::updateFailed, 0);
      }
      self->noteEnd();
    });
  } catch (...) {
    (void)ReleaseBusyToken(server, token);  // one bit, as it was given: no check will do it
    throw;
  }
}

void LASDUpdater::check(ServerContext& server, std::uint32_t mask) {
  outOfMemory_ = 0;
  note(mask, LastCheck::Outcome::checking);
  loadVersions(kVersionsDomain, VersionSource::preferences, mask);
  const std::int64_t result = loadVersions(parts_->manifestUrl, VersionSource::manifest, mask);
  if (result == kNotFetched) return tell(NotificationKind::updateFailed, 0);
  if (result == 0 && outOfMemory_ == 0) {
    logUnified(LogLevel::error, "No update required for any databases");
    return tell(NotificationKind::noUpdateRequired, 0);
  }
  for (const std::int32_t type : kDatabaseTypesInOrder) {
    if ((outOfMemory_ & type) != 0) {
      giveUp(type);
      tell(NotificationKind::updateFailed, type);
    } else if ((result & type) != 0) {
      const HeldToken own(server);
      updateDatabase(type);
    }
  }
}

std::vector<LASDUpdater::LastCheck> LASDUpdater::lastChecks() const {
  std::vector<LastCheck> checks;
  const std::lock_guard lock(checksMutex_);
  for (const LastCheck& each : lastChecks_) {
    if (each.type != 0) checks.push_back(each);
  }
  return checks;
}

void LASDUpdater::note(std::uint32_t mask, LastCheck::Outcome outcome) noexcept {
  const std::lock_guard lock(checksMutex_);
  for (std::size_t i = 0; i < lastChecks_.size(); ++i) {
    const std::int32_t type = kDatabaseTypesInOrder[i];
    if ((mask & static_cast<std::uint32_t>(type)) != 0) lastChecks_[i] = {type, outcome, now_()};
  }
}

void LASDUpdater::noteEnd() noexcept {
  const std::lock_guard lock(checksMutex_);
  for (LastCheck& each : lastChecks_) {
    if (each.outcome == LastCheck::Outcome::checking) each = {each.type, LastCheck::Outcome::failed, now_()};
  }
}

void LASDUpdater::tell(NotificationKind kind, std::int32_t type) noexcept try {
  sendNotification(parts_->messagePorts, makeNotification(kind, type));
} catch (...) {
  // No memory for it: dropped, as any notification that cannot be sent.
}

std::int64_t LASDUpdater::loadVersions(const std::string& source, VersionSource kind, std::uint32_t mask) {
  if (kind == VersionSource::preferences) {
    logUnified(LogLevel::info, "Reading local resource %s", source.c_str());
    for (const std::int32_t type : kDatabaseTypesInOrder) {
      if ((mask & static_cast<std::uint32_t>(type)) == 0) continue;
      try {
        versions_[type] = onlyDictionary(parts_->preferences.copyValue(
            keyOfDatabaseType(type), source, UserScope::currentUser, HostScope::anyHost));
      } catch (const std::bad_alloc&) {
        versions_.erase(type);  // an earlier check's entry would be taken for the present one
        outOfMemory_ |= type;
      }
    }
    return 0;
  }

  HttpFetcher fetcher({parts_->queues, parts_->web, parts_->gunzip, parts_->diskSpace});
  if (!fetcher.fetch(source, WifiOnly::yes, kLargestManifest)) {
    logUnified(LogLevel::error, "Could not fetch data from source %s", source.c_str());
    return kNotFetched;
  }
  const PropertyList manifest = onlyDictionary(parsePropertyList(fetcher.bodyAsData()));
  if (!manifest) {
    // Told apart from a failed fetch on purpose: the caller takes it for "nothing to do".
    logUnified(LogLevel::error, "Could not create version dictionary from downloaded plist!");
    return 0;
  }
  return compareWithManifest(manifest, mask);
}

std::int64_t LASDUpdater::compareWithManifest(const PropertyList& manifest, std::uint32_t mask) {
  std::int64_t result = 0;
  for (auto& [type, record] : versions_) {
    try {
      if ((static_cast<std::uint32_t>(type) & mask) == 0) continue;
      const PropertyList serverEntry = onlyDictionary(manifest.find(nameOfDatabaseType(type)));
      if (isUpToDate(manifest, type) || !serverEntry) {
        note(static_cast<std::uint32_t>(type), LastCheck::Outcome::noUpdateRequired);
        continue;
      }
      record = ownCopy(serverEntry);
      result |= type;
    } catch (const std::bad_alloc&) {
      outOfMemory_ |= type;
    }
  }
  return result;
}

bool LASDUpdater::isUpToDate(const PropertyList& manifest, std::int32_t type) {
  if (!manifest) return false;
  const char* const name = nameOfDatabaseType(type);
  const PropertyList serverEntry = onlyDictionary(manifest.find(name));
  if (!serverEntry) {
    logUnified(LogLevel::info, "%s db is not present locally, update required", name);
    return false;
  }
  const PropertyList serverVersion = onlyString(serverEntry.find(kVersionKey));
  const PropertyList localRecord = versions_[type];
  const PropertyList localVersion = onlyString(localRecord.find(kVersionKey));
  if (!localRecord || (!localVersion && serverVersion)) {
    logUnified(LogLevel::info,
               "We have don't have a previously downloaded %s database, server has %s, update required", name,
               shown(serverVersion).c_str());
    return false;
  }
  if (localVersion && serverVersion && sameVersion(textOf(localVersion), textOf(serverVersion))) {
    logUnified(LogLevel::info, "%s version %s matches server version", name, shown(localVersion).c_str());
    return true;
  }
  logUnified(LogLevel::info, "We have %s version %s, server has %s, update required", name,
             shown(localVersion).c_str(), shown(serverVersion).c_str());
  return false;
}

void LASDUpdater::updateDatabase(std::int32_t type) {
  const char* const name = nameOfDatabaseType(type);
  const auto found = versions_.find(type);
  const PropertyList record = found != versions_.end() ? found->second : PropertyList();
  const PropertyList url = onlyString(record.find(kContentUrlKey));
  if (!url) {
    logUnified(LogLevel::error, "Could not find %s database URL", name);
    return;
  }
  if (textOf(url).empty()) {
    logUnified(LogLevel::error, "URL for %s database is empty", name);
    return;
  }
  bool ok = false;
  try {
    DatabaseInstaller installer({{parts_->queues, parts_->web, parts_->gunzip, parts_->diskSpace},
                                 parts_->preferences,
                                 parts_->directory});
    ok = installer.downloadAndInstall(std::string(textOf(url)), type, record);
  } catch (const std::bad_alloc&) {
    giveUp(type);
  }
  note(static_cast<std::uint32_t>(type), ok ? LastCheck::Outcome::updated : LastCheck::Outcome::failed);
  tell(ok ? NotificationKind::updateAvailable : NotificationKind::updateFailed, type);
}

}  // namespace brenvik
