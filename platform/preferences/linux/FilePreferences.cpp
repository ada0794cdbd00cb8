// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/preferences/linux/FilePreferences.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <map>
#include <new>
#include <utility>
#include <vector>

#include "platform/base/ErrorText.h"
#include "platform/base/PasswordEntry.h"
#include "platform/base/UniqueFd.h"
#include "platform/log/Log.h"
#include "platform/plist/EditableDictionary.h"
#include "platform/preferences/linux/DomainFile.h"

#ifndef BRENVIK_ANY_USER_PREFERENCES
#error "the build says where the preferences of any user are"
#endif

namespace brenvik {
namespace {

// Clients name domains freely; each that is kept costs its content and one descriptor.
constexpr std::size_t kMaxDomains = 16;
constexpr std::size_t kMaxKeptBytes = std::size_t{16} << 20;

std::string homeOfEffectiveUser(int* failure) {
  std::optional<PasswordEntry> entry;
  *failure = readPasswordEntry(::geteuid(), &entry);
  if (*failure == ENOMEM) throw std::bad_alloc();
  return entry ? entry->home : std::string();
}

// machine-id(5): 32 lower-case hexadecimal digits and a line feed.
std::string machineId(int* failure) {
  const UniqueFd file(::open("/etc/machine-id", O_RDONLY | O_CLOEXEC | O_NOCTTY));
  std::array<char, 64> text{};
  const ssize_t got = file.isValid() ? ::read(file.get(), text.data(), text.size()) : -1;
  if (got < 0) {
    *failure = errno;
    return {};
  }
  std::string id(text.data(), static_cast<std::size_t>(got));
  if (!id.empty() && id.back() == '\n') id.pop_back();
  const bool isId = id.size() == 32 && id.find_first_not_of("0123456789abcdef") == std::string::npos;
  return isId ? id : std::string();
}

// Runs the work of a store; a lack of memory passes on, logged.
template <typename Work>
bool loggingLackOfMemory(Work work) {
  try {
    return work();
  } catch (const std::bad_alloc&) {
    logUnified(LogLevel::error, "Preferences: no memory to store a domain");
    throw;
  }
}

void keepKnown(std::string& known, std::string& found) noexcept {
  if (!known.empty()) found = std::move(known);
}

}  // namespace

// One domain in one scope: its file as last seen, and what was set since.
class FilePreferences::Domain {
 public:
  Domain(DomainPlace place, std::string name, PreferencesScope scope, std::chrono::milliseconds patience)
      : name_(std::move(name)), scope_(scope), file_(std::move(place)), patience_(patience) {}

  const std::string& name() const noexcept { return name_; }
  const std::string& path() const noexcept { return file_.path(); }
  bool is(std::string_view name, UserScope user, HostScope host) const noexcept {
    return name_ == name && scope_.user == user && scope_.host == host;
  }

  void setValue(std::string_view key, const PropertyList& value) {
    const std::lock_guard lock(mutex_);
    pending_.insert_or_assign(std::string(key), value);
  }

  PropertyList copyValue(std::string_view key) {
    const std::lock_guard lock(mutex_);
    if (const auto set = pending_.find(key); set != pending_.end()) return set->second;
    // Somebody may have replaced or removed the file since: one look, and a read only if it changed.
    if (!isCurrent()) load(nullptr);
    return values_.find(key);
  }

  bool synchronize() {
    const std::lock_guard lock(mutex_);
    if (pending_.empty()) {
      if (!isCurrent()) load(nullptr);
      return true;
    }
    // Also when memory runs out on the way: what was not stored is dropped, and the file is read anew.
    struct Drop {
      Domain& domain;
      bool isStored = false;
      ~Drop() {
        domain.pending_.clear();
        if (!isStored) domain.forgetContent();
      }
    } drop{*this};
    drop.isStored = store();
    return drop.isStored;
  }

  void forget() noexcept {
    const std::lock_guard lock(mutex_);
    forgetContent();
  }

  // Bytes that forgetting this domain would free; nothing while it may not be forgotten.
  std::optional<std::size_t> weight() {
    const std::unique_lock lock(mutex_, std::try_to_lock);
    if (!lock.owns_lock() || !pending_.empty()) return std::nullopt;
    return values_.memory();
  }

 private:
  bool isCurrent() const noexcept { return isLoaded_ && isSettled_ && file_.stamp() == stamp_; }

  void forgetContent() noexcept {
    EditableDictionary none;
    std::swap(values_, none);  // an assignment would keep the memory
    stamp_ = {};
    pin_.reset();
    isLoaded_ = isDurable_ = canStore_ = false;
  }

  void load(const FolderLock* held) {
    forgetContent();
    DomainFile::Loaded loaded = file_.load(patience_, held);
    values_ = std::move(loaded.values);
    stamp_ = loaded.stamp;
    pin_ = std::move(loaded.pin);
    isSettled_ = loaded.isSettled;
    canStore_ = loaded.state != DomainFile::State::unavailable;
    isLoaded_ = true;
  }

  bool store() {
    const UniqueFd folder = file_.openFolder();
    FolderLock held;
    if (!folder.isValid() || !file_.lock(folder.get(), patience_, held)) return false;
    // What a reader could not mend may be mended under the lock; if not, there is a line that says why.
    if (!isCurrent() || !canStore_) load(&held);
    if (!canStore_) return false;
    bool isWhole = true;
    bool isChanged = false;
    for (const auto& [key, value] : pending_) {
      switch (values_.set(key, value)) {
        case EditableDictionary::Change::none:
          break;
        case EditableDictionary::Change::made:
          isChanged = true;
          break;
        case EditableDictionary::Change::refused:
          logUnified(LogLevel::error, "Preferences %s: a value is too deep or too large to be stored",
                     path().c_str());
          isWhole = false;
          break;
      }
    }
    // Nothing to do for what stands in the file already, unless someone else wrote it and perhaps did not
    // sync.
    const bool isStored = !isChanged && (isDurable_ || stamp_.size < 0);
    if (isStored) return isWhole;
    isDurable_ = false;
    const auto content = values_.content();
    if (!file_.replace(folder.get(), content, stamp_, pin_)) return false;
    isDurable_ = isSettled_ = true;
    return isWhole;
  }

  const std::string name_;
  const PreferencesScope scope_;
  DomainFile file_;
  const std::chrono::milliseconds patience_;

  std::mutex mutex_;                                          // of what follows
  std::map<std::string, PropertyList, std::less<>> pending_;  // no value: to be removed
  EditableDictionary values_;                                 // of the file
  FileStamp stamp_;
  UniqueFd pin_;
  bool isLoaded_ = false;
  bool isSettled_ = false;
  bool isDurable_ = false;  // this object wrote the file as it stands
  bool canStore_ = false;
};

FilePreferences::Places FilePreferences::systemPlaces() {
  Places places;
  places.home = homeOfEffectiveUser(&places.homeError);
  places.anyUser = BRENVIK_ANY_USER_PREFERENCES;
  places.machineId = machineId(&places.machineIdError);
  return places;
}

FilePreferences::FilePreferences(std::function<Places()> places, std::chrono::milliseconds patience)
    : askForPlaces_(std::move(places)), patience_(patience) {}

FilePreferences::~FilePreferences() = default;

void FilePreferences::lookUpPlaces(UserScope user, HostScope host) {
  const bool isKnown = places_ && !(user == UserScope::currentUser && places_->home.empty()) &&
                       !(host == HostScope::currentHost && places_->machineId.empty());
  if (isKnown) return;
  Places found = askForPlaces_();
  if (places_) {
    // What was found once stays, even if this look-up failed.
    keepKnown(places_->home, found.home);
    keepKnown(places_->anyUser, found.anyUser);
    keepKnown(places_->machineId, found.machineId);
  }
  places_ = std::move(found);
}

std::optional<DomainPlace> FilePreferences::placeOf(std::string_view domain, UserScope user, HostScope host) {
  if (!namesPreferencesFile(domain)) return std::nullopt;
  lookUpPlaces(user, host);
  DomainPlace place;
  if (user == UserScope::currentUser) {
    if (places_->home.empty()) return std::nullopt;
    place = {places_->home, "Library/Preferences", "", 0700, 0600};
  } else {
    if (places_->anyUser.empty()) return std::nullopt;
    // What is for any user can be read by any user.
    place = {"/", places_->anyUser, "", 0755, 0644};
  }
  place.name = domain;
  if (host == HostScope::currentHost) {
    if (places_->machineId.empty()) return std::nullopt;
    place.folder += "/ByHost";
    place.name += "." + places_->machineId;
  }
  place.name += ".plist";
  return place;
}

void FilePreferences::logNothingStored(std::string_view domain, UserScope user, HostScope host) {
  if (!namesPreferencesFile(domain)) {
    logUnified(LogLevel::error, "Preferences: domain \"%.*s\" names no file, nothing is stored",
               static_cast<int>(domain.size()), domain.data());
    return;
  }
  const std::lock_guard lock(mutex_);
  const bool lacksHome = user == UserScope::currentUser && places_ && places_->home.empty();
  const bool lacksMachine = host == HostScope::currentHost && places_ && places_->machineId.empty();
  const int error = lacksHome ? places_->homeError : lacksMachine ? places_->machineIdError : 0;
  logUnified(LogLevel::error, "Preferences: no %s is known (%s), the value for domain \"%.*s\" is not stored",
             lacksHome      ? "home directory"
             : lacksMachine ? "machine id"
                            : "folder",
             error != 0 ? describeError(error) : "there is none", static_cast<int>(domain.size()),
             domain.data());
}

std::shared_ptr<FilePreferences::Domain> FilePreferences::find(std::string_view domain, UserScope user,
                                                               HostScope host) {
  const std::lock_guard lock(mutex_);
  const auto known = std::find_if(domains_.begin(), domains_.end(),
                                  [&](const auto& one) { return one->is(domain, user, host); });
  if (known != domains_.end()) {
    domains_.splice(domains_.begin(), domains_, known);
    return domains_.front();
  }
  auto place = placeOf(domain, user, host);
  if (!place) return nullptr;
  std::size_t count = 0;
  std::size_t bytes = 0;
  for (auto one = domains_.begin(); one != domains_.end();) {
    const auto weight = one->use_count() > 1 ? std::nullopt : (*one)->weight();
    ++count;
    bytes += weight.value_or(0);
    one = weight && (count >= kMaxDomains || bytes > kMaxKeptBytes) ? domains_.erase(one) : std::next(one);
  }
  domains_.push_front(std::make_shared<Domain>(std::move(*place), std::string(domain),
                                               PreferencesScope{user, host}, patience_));
  return domains_.front();
}

void FilePreferences::setValue(std::string_view key, const PropertyList& value, std::string_view domain,
                               UserScope user, HostScope host) {
  try {
    if (const auto found = find(domain, user, host)) {
      found->setValue(key, value);
    } else {
      logNothingStored(domain, user, host);
    }
  } catch (const std::bad_alloc&) {
    logUnified(LogLevel::error, "Preferences: no memory to set a value");
    throw;
  }
}

bool FilePreferences::synchronize(std::string_view domain, UserScope user, HostScope host) {
  return loggingLackOfMemory([&] {
    const auto found = find(domain, user, host);
    return found != nullptr && found->synchronize();
  });
}

PropertyList FilePreferences::copyValue(std::string_view key, std::string_view domain, UserScope user,
                                        HostScope host) {
  const auto found = find(domain, user, host);
  return found != nullptr ? found->copyValue(key) : PropertyList();
}

bool FilePreferences::synchronizeApplication(std::string_view domain) {
  return loggingLackOfMemory([&] {
    bool isWhole = namesPreferencesFile(domain);
    for (const auto [user, host] : kApplicationScopes) {
      if (const auto found = find(domain, user, host)) isWhole = found->synchronize() && isWhole;
    }
    return isWhole;
  });
}

PropertyList FilePreferences::copyApplicationValue(std::string_view key, std::string_view domain) {
  for (const auto [user, host] : kApplicationScopes) {
    if (PropertyList value = copyValue(key, domain, user, host)) return value;
  }
  return {};
}

void FilePreferences::flushCachesForAnyUser(const std::string* domain) noexcept {
  if (domain == nullptr) return;
  try {
    std::vector<std::shared_ptr<Domain>> found;
    {
      const std::lock_guard lock(mutex_);
      for (const auto& one : domains_) {
        if (one->name() == *domain) found.push_back(one);
      }
    }
    for (const auto& one : found) one->forget();
  } catch (const std::bad_alloc&) {
    logUnified(LogLevel::error, "Preferences: no memory to flush a domain");
  }
}

}  // namespace brenvik
