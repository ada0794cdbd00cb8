// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <functional>
#include <optional>
#include <string>

#include "platform/voicemail/VoicemailStore.h"

namespace brenvik {

// The tokens in an SQLite database, <home>/Library/Voicemail/voicemail.db, made on first use and owned by the
// account. It is opened for each operation, so that an idle helper keeps neither it nor its lock. A database
// that is damaged is moved aside, to voicemail.db.damaged, and a new one made.
class SqliteVoicemailStore final : public VoicemailStore {
 public:
  struct Account {
    std::string home;  // empty: the account has none, and the store is always empty
    uid_t uid;
    gid_t gid;
  };

  // `account` is asked by each operation, so that nothing is looked up before the first; it may throw
  // std::bad_alloc.
  explicit SqliteVoicemailStore(std::function<Account()> account) : account_(std::move(account)) {}
  SqliteVoicemailStore(std::string home, uid_t uid, gid_t gid)
      : account_([account = Account{std::move(home), uid, gid}] { return account; }) {}

  bool setToken(const std::string* token) noexcept override;
  bool setTokenForKey(const std::string& key, const std::string& token) noexcept override;
  bool removeAllRecords() noexcept override;
  bool readToken(std::optional<std::string>* token) noexcept override;
  bool readTokenForKey(const std::string& key, std::optional<std::string>* token) noexcept override;

 private:
  class Database;
  enum class IfMissing { fail, create };

  bool makePlace(std::string* file, IfMissing ifMissing);
  bool write(const char* statement, const std::string* first, const std::string* second) noexcept;
  bool read(const char* statement, const std::string* key, std::optional<std::string>* token) noexcept;

  const std::function<Account()> account_;
};

}  // namespace brenvik
