// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/voicemail/linux/SqliteVoicemailStore.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <new>

#include "platform/base/UniqueFd.h"
#include "platform/log/Log.h"
#include "platform/sqlite/Sqlite.h"

namespace brenvik {
namespace {

constexpr int kBusyMilliseconds = 1000;  // as long as the main loop may wait for another process

constexpr const char* kFolderInTheMaking = ".brenvik-folder";

constexpr const char* kSchema =
    "CREATE TABLE IF NOT EXISTS general(id INTEGER PRIMARY KEY CHECK(id = 0), token TEXT NOT NULL);"
    "CREATE TABLE IF NOT EXISTS tokens(key TEXT PRIMARY KEY NOT NULL, token TEXT NOT NULL) WITHOUT ROWID;";

bool isDamage(int code) {
  const int primary = code & 0xFF;
  return primary == SQLITE_NOTADB || primary == SQLITE_CORRUPT;
}

// Makes the directory below another one for the account, unless it is there. Never follows a link: the
// account's own directories are its user's to rearrange.
UniqueFd enterDirectory(int parent, const char* name, mode_t mode, uid_t uid, gid_t gid, bool create) {
  constexpr int kFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
  UniqueFd fd(::openat(parent, name, kFlags));
  if (fd.isValid() || errno != ENOENT || !create) return fd;
  // Under another name until it is the account's: killed in between, a helper would leave the account a
  // folder that it may not enter. One left so is used.
  if (::mkdirat(parent, kFolderInTheMaking, 0700) != 0 && errno != EEXIST) return {};
  fd.reset(::openat(parent, kFolderInTheMaking, kFlags));
  if (!fd.isValid() || ::fchown(fd.get(), uid, gid) != 0 || ::fchmod(fd.get(), mode) != 0 ||
      ::renameat(parent, kFolderInTheMaking, parent, name) != 0) {
    (void)::unlinkat(parent, kFolderInTheMaking, AT_REMOVEDIR);  // the next attempt copes with what stays
    return {};
  }
  (void)::fsync(parent);  // or a power cut takes the folder with the tokens in it
  return fd;
}

}  // namespace

// One opened database.
class SqliteVoicemailStore::Database {
 public:
  // SQLITE_OK or SQLite's extended code.
  int open(const std::string& file) {
    bool lackedMemory = false;
    if (sqlite(&lackedMemory) == nullptr) return lackedMemory ? SQLITE_NOMEM : SQLITE_CANTOPEN;
    sqlite3* opened = nullptr;
    const int code = sqlite()->open_v2(file.c_str(), &opened,
                                       SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOFOLLOW | SQLITE_OPEN_EXRESCODE |
                                           SQLITE_OPEN_PRIVATECACHE | SQLITE_OPEN_NOMUTEX,
                                       nullptr);
    handle_.reset(opened);
    if (code != SQLITE_OK) return code;
    // The file belongs to an ordinary account: nothing in its schema is believed.
    sqlite()->db_config(opened, SQLITE_DBCONFIG_DEFENSIVE, 1, nullptr);
    sqlite()->db_config(opened, SQLITE_DBCONFIG_TRUSTED_SCHEMA, 0, nullptr);
    sqlite()->db_config(opened, SQLITE_DBCONFIG_ENABLE_TRIGGER, 0, nullptr);
    sqlite()->db_config(opened, SQLITE_DBCONFIG_ENABLE_VIEW, 0, nullptr);
    sqlite()->busy_timeout(opened, kBusyMilliseconds);
    const int failed = execute("PRAGMA journal_mode=DELETE; PRAGMA synchronous=FULL;");
    return failed != SQLITE_OK ? failed : execute(kSchema);
  }

  int execute(const char* statements) {
    return sqlite()->exec(handle_.get(), statements, nullptr, nullptr, nullptr);
  }

  // Runs one statement with up to two texts bound; *result gets the first column of the first row, if any.
  int run(const char* statement, const std::string* first, const std::string* second,
          std::optional<std::string>* result) {
    sqlite3_stmt* prepared = nullptr;
    int code = sqlite()->prepare_v3(handle_.get(), statement, -1, 0, &prepared, nullptr);
    const SqliteStatement owner(prepared);
    if (code != SQLITE_OK) return code;
    int index = 0;
    for (const std::string* text : {first, second}) {
      if (text == nullptr) continue;
      code =
          sqlite()->bind_text(prepared, ++index, text->data(), static_cast<int>(text->size()), SQLITE_STATIC);
      if (code != SQLITE_OK) return code;
    }
    code = sqlite()->step(prepared);
    if (code == SQLITE_ROW && result != nullptr && sqlite()->column_type(prepared, 0) == SQLITE_TEXT) {
      const unsigned char* const text = sqlite()->column_text(prepared, 0);
      if (text == nullptr) return SQLITE_NOMEM;
      result->emplace(reinterpret_cast<const char*>(text),
                      static_cast<std::size_t>(sqlite()->column_bytes(prepared, 0)));
    }
    return code == SQLITE_ROW || code == SQLITE_DONE ? SQLITE_OK : code;
  }

 private:
  SqliteDatabase handle_;
};

// Makes the folders and the empty file, each with its owner and mode, and gives the file's path. SQLite
// refuses a path with a link in it, so links above the home are resolved first.
bool SqliteVoicemailStore::makePlace(std::string* file, IfMissing ifMissing) {
  const Account account = account_();
  if (account.home.empty()) return false;
  const std::unique_ptr<char, decltype(&std::free)> home(::realpath(account.home.c_str(), nullptr),
                                                         &std::free);
  if (!home && errno == ENOMEM) throw std::bad_alloc();
  if (!home) return false;
  const bool create = ifMissing == IfMissing::create;
  const UniqueFd top(::open(home.get(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  const UniqueFd library = enterDirectory(top.get(), "Library", 0755, account.uid, account.gid, create);
  const UniqueFd folder = enterDirectory(library.get(), "Voicemail", 0700, account.uid, account.gid, create);
  if (!folder.isValid()) return false;
  UniqueFd database(::openat(folder.get(), "voicemail.db", O_RDWR | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!database.isValid() && errno == ENOENT && create) {
    database.reset(
        ::openat(folder.get(), "voicemail.db", O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  }
  struct stat info {};
  if (!database.isValid() || ::fstat(database.get(), &info) != 0 || !S_ISREG(info.st_mode)) return false;
  // The journal takes its owner and mode from the database. Of a name elsewhere nothing is given away.
  if ((info.st_uid != account.uid || info.st_gid != account.gid) && info.st_nlink == 1 &&
      ::fchown(database.get(), account.uid, account.gid) != 0) {
    return false;
  }
  if ((info.st_mode & 07777) != 0600 && ::fchmod(database.get(), 0600) != 0) return false;
  *file = std::string(home.get()) + "/Library/Voicemail/voicemail.db";
  return true;
}

bool SqliteVoicemailStore::write(const char* statement, const std::string* first,
                                 const std::string* second) noexcept {
  int code = SQLITE_CANTOPEN;
  try {
    std::string file;
    for (int attempt = 0; attempt < 2 && makePlace(&file, IfMissing::create); ++attempt) {
      Database database;
      code = database.open(file);
      if (code == SQLITE_OK) code = database.run(statement, first, second, nullptr);
      if (!isDamage(code)) break;
      // Nothing in it can be read any more; a person may still want to look at it.
      logUnified(LogLevel::error, "The voicemail store is damaged; moved aside to voicemail.db.damaged");
      if (::rename(file.c_str(), (file + ".damaged").c_str()) != 0) break;
    }
  } catch (const std::bad_alloc&) {
    code = SQLITE_NOMEM;
  }
  if (code != SQLITE_OK) logUnified(LogLevel::error, "The voicemail store could not be written");
  return !isLackOfMemory(code);
}

bool SqliteVoicemailStore::read(const char* statement, const std::string* key,
                                std::optional<std::string>* token) noexcept {
  token->reset();
  try {
    std::string file;
    if (!makePlace(&file, IfMissing::fail)) return true;
    Database database;
    int code = database.open(file);
    if (code == SQLITE_OK) code = database.run(statement, key, nullptr, token);
    return !isLackOfMemory(code);
  } catch (const std::bad_alloc&) {
    return false;
  }
}

bool SqliteVoicemailStore::setToken(const std::string* token) noexcept {
  if (token == nullptr) return write("DELETE FROM general", nullptr, nullptr);
  return write("INSERT INTO general(id, token) VALUES(0, ?1) ON CONFLICT(id) DO UPDATE SET token = ?1", token,
               nullptr);
}

bool SqliteVoicemailStore::setTokenForKey(const std::string& key, const std::string& token) noexcept {
  return write("INSERT INTO tokens(key, token) VALUES(?1, ?2) ON CONFLICT(key) DO UPDATE SET token = ?2",
               &key, &token);
}

bool SqliteVoicemailStore::removeAllRecords() noexcept {
  return write("DELETE FROM tokens", nullptr, nullptr);
}

bool SqliteVoicemailStore::readToken(std::optional<std::string>* token) noexcept {
  return read("SELECT token FROM general WHERE id = 0", nullptr, token);
}

bool SqliteVoicemailStore::readTokenForKey(const std::string& key,
                                           std::optional<std::string>* token) noexcept {
  return read("SELECT token FROM tokens WHERE key = ?1", &key, token);
}

}  // namespace brenvik
