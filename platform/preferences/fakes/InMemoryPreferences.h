// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <map>
#include <mutex>
#include <new>
#include <optional>
#include <string>
#include <string_view>
#include <tuple>
#include <utility>
#include <vector>

#include "platform/log/Log.h"
#include "platform/plist/PropertyListCodec.h"
#include "platform/preferences/PreferencesStore.h"

namespace brenvik {

// What several stores share, as processes share a disk.
class InMemoryDisk {
 public:
  using DomainName = std::tuple<std::string, UserScope, HostScope>;
  using Values = std::map<std::string, PropertyList, std::less<>>;

  Values read(const DomainName& name) const {
    const std::lock_guard lock(mutex_);
    const auto found = domains_.find(name);
    return found != domains_.end() ? found->second : Values();
  }
  // False, and nothing changed, while the disk is full.
  bool merge(const DomainName& name, const Values& changes) {
    const std::lock_guard lock(mutex_);
    if (isFull_) return false;
    Values& values = domains_[name];
    for (const auto& [key, value] : changes) {
      if (value) {
        values.insert_or_assign(key, value);
      } else {
        values.erase(key);
      }
    }
    return true;
  }
  void setFull(bool isFull) {
    const std::lock_guard lock(mutex_);
    isFull_ = isFull;
  }

 private:
  mutable std::mutex mutex_;
  std::map<DomainName, Values> domains_;
  bool isFull_ = false;
};

// A preferences store without files, no kinder than the one with them: nothing reaches others before
// synchronize(), and a full disk drops what was set. Any thread.
class InMemoryPreferences final : public PreferencesStore {
 public:
  // With a disk of its own, or one that it shares and that outlives it.
  InMemoryPreferences() : disk_(&own_) {}
  explicit InMemoryPreferences(InMemoryDisk& disk) : disk_(&disk) {}

  InMemoryDisk& disk() noexcept { return *disk_; }

  void setValue(std::string_view key, const PropertyList& value, std::string_view domain, UserScope user,
                HostScope host) override {
    if (!namesPreferencesFile(domain)) {
      logUnified(LogLevel::error, "Preferences: domain \"%.*s\" names no file, nothing is stored",
                 static_cast<int>(domain.size()), domain.data());
      return;
    }
    takeMemory();
    const std::lock_guard lock(mutex_);
    pending_[{std::string(domain), user, host}].insert_or_assign(std::string(key), value);
  }

  bool synchronize(std::string_view domain, UserScope user, HostScope host) override {
    if (!namesPreferencesFile(domain)) return false;
    const std::lock_guard lock(mutex_);
    const InMemoryDisk::DomainName name{std::string(domain), user, host};
    auto pending = std::exchange(pending_[name], {});
    takeMemory();
    const bool isSound =
        std::erase_if(pending, [](const auto& one) { return !canBeStored(one.first, one.second); }) == 0;
    if (!isSound) logUnified(LogLevel::error, "Preferences: a value is too deep or too large to be stored");
    const bool isStored = pending.empty() || disk_->merge(name, pending);
    if (!isStored) logUnified(LogLevel::error, "Preferences: the disk is full");
    return isStored && isSound;
  }

  PropertyList copyValue(std::string_view key, std::string_view domain, UserScope user,
                         HostScope host) override {
    if (!namesPreferencesFile(domain)) return {};
    takeMemory();
    const std::lock_guard lock(mutex_);
    const InMemoryDisk::DomainName name{std::string(domain), user, host};
    const InMemoryDisk::Values& pending = pending_[name];
    if (const auto set = pending.find(key); set != pending.end()) return set->second;
    const InMemoryDisk::Values values = disk_->read(name);
    const auto found = values.find(key);
    return found != values.end() ? found->second : PropertyList();
  }

  bool synchronizeApplication(std::string_view domain) override {
    bool isWhole = true;
    for (const auto [user, host] : kApplicationScopes) isWhole = synchronize(domain, user, host) && isWhole;
    return isWhole;
  }

  PropertyList copyApplicationValue(std::string_view key, std::string_view domain) override {
    for (const auto [user, host] : kApplicationScopes) {
      if (PropertyList value = copyValue(key, domain, user, host)) return value;
    }
    return {};
  }

  void flushCachesForAnyUser(const std::string* domain) noexcept override {
    const std::lock_guard lock(mutex_);
    flushes.push_back(domain != nullptr ? std::optional<std::string>(*domain) : std::nullopt);
  }

  // What was asked to be flushed, in order; nothing: no domain in particular. Read it from the thread under
  // test.
  std::vector<std::optional<std::string>> flushes;

  // How many more operations on a domain with a file find memory; negative: all do. Main thread of a test.
  int operationsWithMemory = -1;

 private:
  // Counts one operation.
  void takeMemory() {
    if (operationsWithMemory == 0) throw std::bad_alloc();
    if (operationsWithMemory > 0) --operationsWithMemory;
  }

  // A domain is a dictionary, so a value may be a level less deep than a document.
  static bool canBeStored(const std::string& key, const PropertyList& value) {
    const auto entry = PropertyList::dictionary({{key, value ? value : PropertyList::boolean(true)}});
    return serializePropertyList(entry, PropertyListFormat::binary).has_value();
  }

  InMemoryDisk own_;
  InMemoryDisk* const disk_;
  std::mutex mutex_;
  std::map<InMemoryDisk::DomainName, InMemoryDisk::Values> pending_;
};

}  // namespace brenvik
