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

// The platform's preferences: values by domain, key, user scope and host scope. Any thread. Texts are UTF-8.
//
// A set value is seen by this process at once and by other processes after synchronize(). What others have
// stored, replaced or removed is seen by every read. A domain that names no file, or whose folder is not
// known at the moment, reads as having no values; setting a value there stores nothing and logs an error.
//
// Every function but flushCachesForAnyUser() throws std::bad_alloc when memory runs out, and nothing else.
class PreferencesStore {
 public:
  virtual ~PreferencesStore() = default;

  // Sets the key's value; an absent value removes the key. When it throws, nothing was set, which is logged.
  virtual void setValue(std::string_view key, const PropertyList& value, std::string_view domain,
                        UserScope user, HostScope host) = 0;

  // Makes what was set durable and reads what others wrote; keys that were not set here stay as others left
  // them. True if every change was written. False when something set could not be stored, which is logged; it
  // is then dropped, so that what is read is what is stored. False, too, for a domain that names no file.
  // When it throws, the same holds, and what others have stored may not have been seen.
  virtual bool synchronize(std::string_view domain, UserScope user, HostScope host) = 0;

  // The key's value in exactly this scope, or none: what was set here and not synchronized yet, else what is
  // stored now.
  virtual PropertyList copyValue(std::string_view key, std::string_view domain, UserScope user,
                                 HostScope host) = 0;

  // Application scope: the first of kApplicationScopes that has the key gives the value. A scope that has no
  // place on this system is passed over.
  virtual bool synchronizeApplication(std::string_view domain) = 0;
  virtual PropertyList copyApplicationValue(std::string_view key, std::string_view domain) = 0;

  // Forgets what is cached of the domain for any user and of every host, so that the next read goes to the
  // files. Null: of no domain in particular, which flushes nothing. Values set and not yet synchronized are
  // kept. A lack of memory is logged.
  virtual void flushCachesForAnyUser(const std::string* domain) noexcept = 0;
};

}  // namespace brenvik
