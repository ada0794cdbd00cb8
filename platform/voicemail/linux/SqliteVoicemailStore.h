// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <utility>

#include "platform/sqlite/SqliteTime.h"
#include "platform/voicemail/VoicemailStore.h"

namespace brenvik {

// The tokens in an SQLite database, <home>/Library/Voicemail/voicemail.db, made on first use and owned by the
// account. It is opened for each operation, so that an idle helper keeps neither it nor its lock. A database
// that is damaged is moved aside, to voicemail.db.damaged or, where there is one already, to
// voicemail.db.damaged.1 and so on, and a new one made.
class SqliteVoicemailStore final : public VoicemailStore {
 public:
  struct Account {
    std::string home;  // empty: the account has none, and the store is always empty
    uid_t uid;
    gid_t gid;
  };

  // How long one operation may wait for other processes and run statements. A request has two at most, and
  // three seconds with what the disk takes.
  static constexpr std::chrono::milliseconds kPatience{1000};

  // `account` is asked by each operation, so that nothing is looked up before the first; it may throw
  // std::bad_alloc.
  explicit SqliteVoicemailStore(std::function<Account()> account, SqliteTime time = SqliteTime::ofTheSystem())
      : account_(std::move(account)), time_(std::move(time)) {}
  SqliteVoicemailStore(std::string home, uid_t uid, gid_t gid, SqliteTime time = SqliteTime::ofTheSystem())
      : SqliteVoicemailStore([account = Account{std::move(home), uid, gid}] { return account; },
                             std::move(time)) {}

  bool setToken(const std::string* token) noexcept override;
  bool setTokenForKey(const std::string& key, const std::string& token) noexcept override;
  bool removeAllRecords() noexcept override;
  bool readToken(std::optional<std::string>* token) noexcept override;
  bool readTokenForKey(const std::string& key, std::optional<std::string>* token) noexcept override;

 private:
  class Database;
  struct Place;
  enum class IfMissing { fail, create };
  enum class Found { database, nothing, unusable };

  Found find(Place* place, IfMissing ifMissing);
  static bool moveAside(const Place& place);
  bool write(const char* statement, const std::string* first, const std::string* second) noexcept;
  bool read(const char* statement, const std::string* key, std::optional<std::string>* token) noexcept;

  const std::function<Account()> account_;
  const SqliteTime time_;
};

}  // namespace brenvik
