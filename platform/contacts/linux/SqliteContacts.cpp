// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/contacts/linux/SqliteContacts.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <new>
#include <string>
#include <utility>

#include "platform/base/Utf8.h"
#include "platform/sqlite/ForeignDatabase.h"
#include "platform/sqlite/HeldFolder.h"

namespace brenvik {
namespace {

constexpr char kFile[] = "contacts.db";

class SqliteChannelManager final : public ContactsChannelManager {
 public:
  SqliteChannelManager(std::chrono::milliseconds patience, SqliteTime time)
      : limit_(patience, std::move(time)) {}

  // False when there is no database; throws std::bad_alloc when there may be one.
  bool open(int folder);

  bool remapChannelIdentifier(std::string_view from, std::string_view to,
                              std::optional<std::string>* error) noexcept override {
    try {
      if (!isValidUtf8(from) || !isValidUtf8(to)) {
        *error = "a channel identifier is not valid UTF-8";
        return false;
      }
      const SqliteFunctions& sql = *sqlite();
      const bool done = remap(from, to);
      // The description goes with the first failure, so it is taken before the transaction is given up.
      if (!done) *error = sql.errmsg(database_.get());
      SqliteTimeLimit::lift(database_.get());
      if (sql.get_autocommit(database_.get()) == 0) (void)run("ROLLBACK");
      limit_.applyTo(database_.get());
      return done;
    } catch (const std::bad_alloc&) {
      // Closing the connection gives up what is unfinished. The error stays absent: it needs memory, too.
      return false;
    }
  }

 private:
  bool run(const char* statement) noexcept {
    return sqlite()->exec(database_.get(), statement, nullptr, nullptr, nullptr) == SQLITE_OK;
  }

  bool remap(std::string_view from, std::string_view to) noexcept {
    // Immediate: wait for other writers here, where waiting cannot end in a deadlock.
    return run("BEGIN IMMEDIATE") && moveReferences(from, to) && run("COMMIT");
  }

  bool moveReferences(std::string_view from, std::string_view to) noexcept {
    constexpr char kMove[] =
        "UPDATE contact_channels SET channel_identifier = ?2 WHERE channel_identifier = ?1";
    const SqliteFunctions& sql = *sqlite();
    sqlite3_stmt* prepared = nullptr;
    if (sql.prepare_v3(database_.get(), kMove, sizeof kMove, 0, &prepared, nullptr) != SQLITE_OK)
      return false;
    const SqliteStatement statement(prepared);
    return bind(prepared, 1, from) && bind(prepared, 2, to) && sql.step(prepared) == SQLITE_DONE;
  }

  static bool bind(sqlite3_stmt* statement, int index, std::string_view text) noexcept {
    // The pointer of an empty view may be null, which would bind no value.
    const char* const bytes = text.empty() ? "" : text.data();
    return sqlite()->bind_text(statement, index, bytes, static_cast<int>(text.size()), SQLITE_STATIC) ==
           SQLITE_OK;
  }

  SqliteTimeLimit limit_;
  SqliteDatabase database_;
};

// A file that answered with one of these will never be read as a database. Anything else (locked, damaged,
// read-only) is for the remap to report.
bool isHopeless(int result) noexcept {
  switch (result & 0xFF) {
    case SQLITE_NOTADB:
    case SQLITE_CANTOPEN:
    case SQLITE_IOERR:
    case SQLITE_PERM:
    case SQLITE_AUTH:
      return true;
    default:
      return false;
  }
}

bool SqliteChannelManager::open(int folder) {
  struct stat status {};
  if (folder < 0 || ::fstatat(folder, kFile, &status, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISREG(status.st_mode))
    return false;
  // The permission bits say what the owner wants; root obeys them, too.
  if ((status.st_mode & (S_IRUSR | S_IRGRP | S_IROTH)) == 0) return false;
  const bool writable = (status.st_mode & (S_IWUSR | S_IWGRP | S_IWOTH)) != 0;
  bool lackedMemory = false;
  const SqliteFunctions* const sql = sqlite(&lackedMemory);
  if (lackedMemory) throw std::bad_alloc();
  if (sql == nullptr) return false;
  sqlite3* opened = nullptr;
  const int flags = (writable ? SQLITE_OPEN_READWRITE : SQLITE_OPEN_READONLY) | SQLITE_OPEN_NOFOLLOW |
                    SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_PRIVATECACHE;
  const int result = sql->open_v2(pathInHeldFolder(folder, kFile).c_str(), &opened, flags, nullptr);
  database_.reset(opened);  // to be closed even when opening failed
  if (isLackOfMemory(result)) throw std::bad_alloc();
  if (result != SQLITE_OK) return false;
  distrustDatabase(opened);
  // SQLite opens anything and reads nothing; the first pragma that needs the file tells whether it is a
  // database. No waiting here: a locked one is a database.
  const int version = sql->exec(opened, "PRAGMA schema_version", nullptr, nullptr, nullptr);
  if (isLackOfMemory(version) || isLackOfMemory(sql->extended_errcode(opened))) throw std::bad_alloc();
  if (isHopeless(version)) return false;
  limit_.applyTo(opened);
  // EXTRA: the folder is synced as well when the journal goes, or a power cut could bring the journal back,
  // and with it the old channels after a success was answered.
  (void)sql->exec(opened, "PRAGMA synchronous=EXTRA; PRAGMA cell_size_check=ON", nullptr, nullptr, nullptr);
  return true;
}

}  // namespace

std::unique_ptr<ContactsChannelManager> SqliteContacts::makeChannelManager() {
  auto manager = std::make_unique<SqliteChannelManager>(patience_, time_);
  if (!manager->open(folder_())) return nullptr;
  return manager;
}

}  // namespace brenvik
