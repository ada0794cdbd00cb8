// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <utility>

#include "platform/contacts/ContactsChannelManager.h"

namespace brenvik {

// The contacts of one account, in <home>/Library/AddressBook/contacts.db.
class SqliteContacts final : public ContactsService {
 public:
  // How long a remap waits for another program's lock: longer than any save of the contacts application, and
  // still shorter than a client's patience with a request.
  static constexpr std::chrono::milliseconds kPatience{3000};

  // How long it may take once nobody is in the way. A million rows take a few seconds; what takes longer is a
  // trigger that never ends, and a database's owner is less trusted than this process.
  static constexpr std::chrono::milliseconds kLongestRemap{20000};

  // `home` gives the account's home directory each time a manager is made; empty: there is none. Of
  // exceptions it may throw std::bad_alloc.
  explicit SqliteContacts(std::function<std::string()> home, std::chrono::milliseconds patience = kPatience,
                          std::chrono::milliseconds longestRemap = kLongestRemap)
      : home_(std::move(home)), patience_(patience), longestRemap_(longestRemap) {}

  // Null when there is no home, no database, none that may be read, or a file that is no database.
  std::unique_ptr<ContactsChannelManager> makeChannelManager(bool* lackedMemory = nullptr) noexcept override;

 private:
  const std::function<std::string()> home_;
  const std::chrono::milliseconds patience_;
  const std::chrono::milliseconds longestRemap_;
};

}  // namespace brenvik
