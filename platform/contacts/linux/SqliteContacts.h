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

// The contacts in contacts.db of an open folder, read with this process's own rights.
class SqliteContacts final : public ContactsService {
 public:
  // How long a manager may wait for other programs' locks and run statements, counted from its construction.
  // With the roll-back that follows, it stays within the three seconds that a request may hold the main loop
  // (2.2 s were measured with a trigger that writes without end). 100,000 references with an index take 0.8
  // s. Only a lock that is never released or a hostile trigger takes longer: the database's owner is less
  // trusted than this process.
  static constexpr std::chrono::milliseconds kPatience{2000};

  // `folder` returns the descriptor of the folder, or -1 if there is none. It is called for each manager, and
  // keeps the descriptor open as long as that manager lives.
  explicit SqliteContacts(std::function<int()> folder, std::chrono::milliseconds patience = kPatience,
                          SqliteTime time = SqliteTime::ofTheSystem())
      : folder_(std::move(folder)), patience_(patience), time_(std::move(time)) {}

  // Returns null if there is no folder, or no database in it that this process can read.
  std::unique_ptr<ContactsChannelManager> makeChannelManager() override;

 private:
  const std::function<int()> folder_;
  const std::chrono::milliseconds patience_;
  const SqliteTime time_;
};

}  // namespace brenvik
