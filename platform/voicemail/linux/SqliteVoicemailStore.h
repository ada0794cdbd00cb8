// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <string>

#include "platform/voicemail/VoicemailStore.h"

struct sqlite3;

namespace brenvik {

// The tokens in an SQLite database, <home>/Library/Voicemail/voicemail.db, made on first use and owned by the
// account. It is opened for each operation, so that an idle helper keeps neither it nor its lock. A database
// that is damaged is moved aside, to voicemail.db.damaged, and a new one made.
class SqliteVoicemailStore final : public VoicemailStore {
 public:
  // `home` empty: the account has none, and the store is always empty.
  SqliteVoicemailStore(std::string home, uid_t uid, gid_t gid)
      : home_(std::move(home)), uid_(uid), gid_(gid) {}

  void setToken(const std::string* token) noexcept override;
  void setTokenForKey(const std::string& key, const std::string& token) noexcept override;
  void removeAllRecords() noexcept override;
  std::optional<std::string> copyToken() noexcept override;
  std::optional<std::string> copyTokenForKey(const std::string& key) noexcept override;

 private:
  class Database;
  enum class IfMissing { fail, create };

  bool makePlace(std::string* file, IfMissing ifMissing);
  void write(const char* statement, const std::string* first, const std::string* second) noexcept;
  std::optional<std::string> read(const char* statement, const std::string* key) noexcept;

  const std::string home_;
  const uid_t uid_;
  const gid_t gid_;
};

}  // namespace brenvik
