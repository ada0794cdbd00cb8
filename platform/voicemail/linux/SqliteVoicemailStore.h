// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "platform/sqlite/SqliteTime.h"
#include "platform/voicemail/VoicemailStore.h"

namespace brenvik {

class SqliteTimeLimit;

// The tokens in an SQLite database, voicemail.db, which the first change makes. It uses only its own
// account's rights: a database that the account may not use is a store that cannot be opened. A damaged
// database is renamed to voicemail.db.damaged or, if that exists, to voicemail.db.damaged.1 and so on, and a
// new one is made.
class SqliteVoicemailStore final : public VoicemailStore {
 public:
  enum class Purpose { reading, writing };

  // How long one operation may wait for other processes and run statements. A request has at most two
  // operations, and three seconds including the disk.
  static constexpr std::chrono::milliseconds kPatience{1000};

  // Returns the descriptor of the store's folder for each operation, and keeps it open. -1 with errno ENOENT
  // means that there is no folder yet and the store is empty. May throw std::bad_alloc.
  using Folder = std::function<int(Purpose)>;
  explicit SqliteVoicemailStore(Folder folder, SqliteTime time = SqliteTime::ofTheSystem());
  ~SqliteVoicemailStore() override;

  void expectUse() noexcept override {}
  void setToken(const std::string* token) override;
  void setTokenForKey(const std::string& key, const std::string& token) override;
  void removeAllRecords() override;
  std::optional<std::string> copyToken() override;
  std::optional<std::string> copyTokenForKey(const std::string& key) override;

 private:
  class Database;
  struct Identity;
  struct Place;
  enum class Found { database, nothing, unusable };

  Found find(Place* place, Purpose purpose);
  int open(const Place& place, SqliteTimeLimit& limit);
  int run(const Place& place, SqliteTimeLimit& limit, const char* statement, const std::string* first,
          const std::string* second, std::optional<std::string>* result);
  static bool moveAside(const Place& place);
  template <typename Work>
  static void perform(Purpose purpose, const Work& work);
  void write(const char* statement, const std::string* first, const std::string* second);
  std::optional<std::string> read(const char* statement, const std::string* key);

  const Folder folder_;
  const SqliteTime time_;
  std::unique_ptr<Database> database_;  // open, or null
};

}  // namespace brenvik
