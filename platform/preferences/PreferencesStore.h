// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/plist/PropertyList.h"

namespace brenvik {

enum class UserScope { currentUser, anyUser };
enum class HostScope { currentHost, anyHost };

struct PreferencesScope {
  UserScope user;
  HostScope host;
};

// Where application scope looks, in this order.
inline constexpr std::array kApplicationScopes{
    PreferencesScope{UserScope::currentUser, HostScope::currentHost},
    PreferencesScope{UserScope::currentUser, HostScope::anyHost},
    PreferencesScope{UserScope::anyUser, HostScope::anyHost}};

// False for a domain that stands for nothing that could be stored: empty, "." or "..", or with a '/' or a
// NUL.
constexpr bool namesPreferencesFile(std::string_view domain) noexcept {
  return !domain.empty() && domain != "." && domain != ".." &&
         domain.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

// How far synchronizing came; true when whole.
class Synchronized {
 public:
  static constexpr Synchronized whole() noexcept { return Synchronized(State::whole); }
  static constexpr Synchronized notWhole() noexcept { return Synchronized(State::notWhole); }
  // Not whole, and what others have stored may not have been seen.
  static constexpr Synchronized withoutMemory() noexcept { return Synchronized(State::withoutMemory); }

  constexpr operator bool() const noexcept { return state_ == State::whole; }
  constexpr bool lackedMemory() const noexcept { return state_ == State::withoutMemory; }

 private:
  enum class State : std::uint8_t { whole, notWhole, withoutMemory };
  constexpr explicit Synchronized(State state) noexcept : state_(state) {}
  State state_;
};

// The platform's preferences: values by domain, key, user scope and host scope. Any thread. Texts are UTF-8.
//
// A set value is seen by this process at once and by other processes after synchronize(). What others have
// stored, replaced or removed is seen by every read. A domain that names no file, or whose folder is not
// known at the moment, reads as having no values; setting a value there stores nothing and logs an error.
// Nothing is thrown: each operation tells whether memory sufficed.
class PreferencesStore {
 public:
  virtual ~PreferencesStore() = default;

  // Sets the key's value; no value removes the key. False when memory ran out and nothing was set.
  virtual bool setValue(std::string_view key, const PropertyList& value, std::string_view domain,
                        UserScope user, HostScope host) noexcept = 0;

  // Makes what was set durable and reads what others wrote; keys that were not set here stay as others left
  // them. Not whole when something set could not be stored, which is logged; it is then dropped, so that what
  // is read is what is stored. Not whole, too, for a domain that names no file.
  virtual Synchronized synchronize(std::string_view domain, UserScope user, HostScope host) noexcept = 0;

  // The key's value in exactly this scope, or none, in *value: what was set here and not synchronized yet,
  // else what is stored now. False when memory ran out, and it is not known.
  virtual bool readValue(std::string_view key, std::string_view domain, UserScope user, HostScope host,
                         PropertyList* value) noexcept = 0;

  // Application scope: the first of kApplicationScopes that has the key gives the value. A scope that has no
  // place on this system is passed over.
  virtual Synchronized synchronizeApplication(std::string_view domain) noexcept = 0;
  virtual bool readApplicationValue(std::string_view key, std::string_view domain,
                                    PropertyList* value) noexcept = 0;

  // For callers that treat "out of memory" like "no value".
  PropertyList copyValue(std::string_view key, std::string_view domain, UserScope user,
                         HostScope host) noexcept {
    PropertyList value;
    return readValue(key, domain, user, host, &value) ? value : PropertyList();
  }
  PropertyList copyApplicationValue(std::string_view key, std::string_view domain) noexcept {
    PropertyList value;
    return readApplicationValue(key, domain, &value) ? value : PropertyList();
  }

  // Forgets what is cached of the domain for any user and of every host, so that the next read goes to the
  // files. `domain` null: of no domain in particular, which flushes nothing. Values set and not yet
  // synchronized are kept.
  virtual void flushCachesForAnyUser(const std::string* domain) noexcept = 0;
};

}  // namespace brenvik
