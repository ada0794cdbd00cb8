// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <utility>

#include "platform/contacts/ContactsChannelManager.h"
#include "platform/sqlite/SqliteTime.h"

namespace brenvik {

// The contacts in contacts.db of an open folder, with no right but this process's own.
class SqliteContacts final : public ContactsService {
 public:
  // How long a manager may wait for other programs' locks and run statements, from its making on. With the
  // time that the disk then takes to undo what was written it stays within the three seconds that a request
  // may hold the main loop (2.2 s were measured with a trigger that writes without end). 100,000 references
  // with an index take 0.8 s. What takes longer is a lock that is never released or a hostile trigger: a
  // database's owner is less trusted than this process.
  static constexpr std::chrono::milliseconds kPatience{2000};

  // `folder` gives the descriptor of the folder each time a manager is made, which keeps it open as long as
  // that lives; -1: there is none.
  explicit SqliteContacts(std::function<int()> folder, std::chrono::milliseconds patience = kPatience,
                          SqliteTime time = SqliteTime::ofTheSystem())
      : folder_(std::move(folder)), patience_(patience), time_(std::move(time)) {}

  // Null when there is no folder, no database, none that may be read, or a file that is no database.
  std::unique_ptr<ContactsChannelManager> makeChannelManager() override;

 private:
  const std::function<int()> folder_;
  const std::chrono::milliseconds patience_;
  const SqliteTime time_;
};

}  // namespace brenvik
