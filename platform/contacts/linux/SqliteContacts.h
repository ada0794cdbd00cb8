// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <utility>

#include "platform/contacts/ContactsChannelManager.h"
#include "platform/sqlite/SqliteTime.h"

namespace brenvik {

// The contacts of one account, in <home>/Library/AddressBook/contacts.db.
class SqliteContacts final : public ContactsService {
 public:
  // How long a manager may wait for other programs' locks and run statements, from its making on. With the
  // time that the disk then takes to undo what was written it stays within the three seconds that a request
  // may hold the main loop (2.2 s were measured with a trigger that writes without end). 100,000 references
  // with an index take 0.8 s. What takes longer is a lock that is never released or a hostile trigger: a
  // database's owner is less trusted than this process.
  static constexpr std::chrono::milliseconds kPatience{2000};

  // `home` gives the account's home directory each time a manager is made; empty: there is none. Of
  // exceptions it may throw std::bad_alloc.
  explicit SqliteContacts(std::function<std::string()> home, std::chrono::milliseconds patience = kPatience,
                          SqliteTime time = SqliteTime::ofTheSystem())
      : home_(std::move(home)), patience_(patience), time_(std::move(time)) {}

  // Null when there is no home, no database, none that may be read, or a file that is no database.
  std::unique_ptr<ContactsChannelManager> makeChannelManager(bool* lackedMemory = nullptr) noexcept override;

 private:
  const std::function<std::string()> home_;
  const std::chrono::milliseconds patience_;
  const SqliteTime time_;
};

}  // namespace brenvik
