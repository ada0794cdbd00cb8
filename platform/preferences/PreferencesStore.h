// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
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

// The scopes that application scope searches, in this order.
inline constexpr std::array kApplicationScopes{
    PreferencesScope{UserScope::currentUser, HostScope::currentHost},
    PreferencesScope{UserScope::currentUser, HostScope::anyHost},
    PreferencesScope{UserScope::anyUser, HostScope::anyHost}};

// False for a domain that cannot be the name of a file: empty, "." or "..", or with a '/' or a NUL.
constexpr bool namesPreferencesFile(std::string_view domain) noexcept {
  return !domain.empty() && domain != "." && domain != ".." &&
         domain.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

// The platform's preferences: values by domain, key, user scope and host scope. Any thread. Texts are UTF-8.
//
// This process sees a set value at once, other processes after synchronize(). Every read sees the changes
// that others have stored. A domain that does not name a file, or whose folder is unknown at the moment, has
// no values; setting a value there stores nothing and logs an error.
//
// Every function but flushCachesForAnyUser() throws std::bad_alloc when memory runs out, and nothing else.
class PreferencesStore {
 public:
  virtual ~PreferencesStore() = default;

  // Sets the key's value; an absent value removes the key. If it throws, nothing was set, and that is logged.
  virtual void setValue(std::string_view key, const PropertyList& value, std::string_view domain,
                        UserScope user, HostScope host) = 0;

  // Makes the values set here durable and reads the changes of others; keys that were not set here stay as
  // others left them. Returns true if every change was written. Returns false if a change could not be
  // stored; it logs and drops the change, so that reads return what is stored. Returns false also for a
  // domain that does not name a file. If it throws, unwritten changes are dropped in the same way, and
  // changes of others may not have been read.
  virtual bool synchronize(std::string_view domain, UserScope user, HostScope host) = 0;

  // Returns the key's value in exactly this scope, or none: the value that was set here and not synchronized
  // yet, else the value that is stored now.
  virtual PropertyList copyValue(std::string_view key, std::string_view domain, UserScope user,
                                 HostScope host) = 0;

  // Application scope: the first of kApplicationScopes that has the key gives the value. Scopes without a
  // place on this system are skipped.
  virtual bool synchronizeApplication(std::string_view domain) = 0;
  virtual PropertyList copyApplicationValue(std::string_view key, std::string_view domain) = 0;

  // Drops the cached values of the domain for any user and every host, so that the next read goes to the
  // files. With null it drops nothing. Values that were set and not yet synchronized are kept. A lack of
  // memory is logged.
  virtual void flushCachesForAnyUser(const std::string* domain) noexcept = 0;
};

}  // namespace brenvik
