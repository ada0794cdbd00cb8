// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/voicemail/linux/SqliteVoicemailStore.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <new>

#include "platform/base/ErrorText.h"
#include "platform/base/Rename.h"
#include "platform/base/UniqueFd.h"
#include "platform/log/Log.h"
#include "platform/sqlite/ForeignDatabase.h"
#include "platform/sqlite/HeldFolder.h"

namespace brenvik {
namespace {

// "voicemail.db.damaged", then "voicemail.db.damaged.1" and so on.
constexpr int kMaxMovedAside = 100;

constexpr const char* kFile = "voicemail.db";

constexpr const char* kSchema =
    "CREATE TABLE IF NOT EXISTS general(id INTEGER PRIMARY KEY CHECK(id = 0), token TEXT NOT NULL);"
    "CREATE TABLE IF NOT EXISTS tokens(key TEXT PRIMARY KEY NOT NULL, token TEXT NOT NULL) WITHOUT ROWID;";

bool isDamage(int code) {
  const int primary = code & 0xFF;
  return primary == SQLITE_NOTADB || primary == SQLITE_CORRUPT;
}

}  // namespace

// Which file it is, of all that are there now.
struct SqliteVoicemailStore::Identity {
  dev_t device = 0;
  ino_t inode = 0;
  static Identity of(const struct stat& info) { return {info.st_dev, info.st_ino}; }
  bool operator==(const Identity&) const = default;
};

// One opened database.
class SqliteVoicemailStore::Database {
 public:
  UniqueFd folder;  // by which SQLite finds the journal, too
  // Which folder and which file they are. Nobody else's as long as they are open.
  Identity folderIs;
  Identity fileIs;

  // SQLITE_OK or SQLite's extended code.
  int open(const std::string& file, SqliteTimeLimit& limit) {
    bool lackedMemory = false;
    if (sqlite(&lackedMemory) == nullptr) return lackedMemory ? SQLITE_NOMEM : SQLITE_CANTOPEN;
    sqlite3* opened = nullptr;
    const int code = sqlite()->open_v2(file.c_str(), &opened,
                                       SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOFOLLOW | SQLITE_OPEN_EXRESCODE |
                                           SQLITE_OPEN_PRIVATECACHE | SQLITE_OPEN_NOMUTEX,
                                       nullptr);
    handle_.reset(opened);
    if (code != SQLITE_OK) return code;
    // The file belongs to an ordinary account.
    distrustDatabase(opened);
    sqlite()->db_config(opened, SQLITE_DBCONFIG_ENABLE_TRIGGER, 0, nullptr);
    sqlite()->db_config(opened, SQLITE_DBCONFIG_ENABLE_VIEW, 0, nullptr);
    limit.applyTo(opened);
    const int failed = prepare();
    SqliteTimeLimit::lift(opened);
    return failed;
  }

  // Runs one statement within the limit.
  int run(SqliteTimeLimit& limit, const char* statement, const std::string* first, const std::string* second,
          std::optional<std::string>* result) {
    limit.applyTo(handle_.get());
    const int code = run(statement, first, second, result);
    SqliteTimeLimit::lift(handle_.get());
    return code;
  }

 private:
  int prepare() {
    // EXTRA: the folder is synced as well when the journal goes, or a power cut could bring the journal back,
    // and with it the state before a change that was answered.
    const int failed = execute("PRAGMA journal_mode=DELETE; PRAGMA synchronous=EXTRA;");
    return failed != SQLITE_OK ? failed : execute(kSchema);
  }

  int execute(const char* statements) {
    return sqlite()->exec(handle_.get(), statements, nullptr, nullptr, nullptr);
  }

  // With up to two texts bound; *result gets the first column of the first row, if any.
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

  SqliteDatabase handle_;
};

SqliteVoicemailStore::SqliteVoicemailStore(Folder folder, SqliteTime time)
    : folder_(std::move(folder)), time_(std::move(time)) {}

SqliteVoicemailStore::~SqliteVoicemailStore() = default;

// Where the database is.
struct SqliteVoicemailStore::Place {
  int folder = -1;
  Identity folderIs;
  Identity fileIs;
};

// Makes the empty file with its mode.
SqliteVoicemailStore::Found SqliteVoicemailStore::find(Place* place, Purpose purpose) {
  const auto missing = [] { return errno == ENOENT ? Found::nothing : Found::unusable; };
  place->folder = folder_(purpose);
  if (place->folder < 0) return missing();
  const int folder = place->folder;
  struct stat info {};
  if (::fstat(folder, &info) != 0) return Found::unusable;
  place->folderIs = Identity::of(info);
  if (database_ != nullptr && place->folderIs == database_->folderIs &&
      ::fstatat(folder, kFile, &info, AT_SYMLINK_NOFOLLOW) == 0 && Identity::of(info) == database_->fileIs &&
      info.st_mode == (S_IFREG | 0600)) {
    place->fileIs = database_->fileIs;
    return Found::database;
  }
  // Closed before the file is looked at: closing any descriptor of a file gives up the process's locks on it.
  database_.reset();
  UniqueFd database(::openat(folder, kFile, O_RDWR | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!database.isValid() && errno == ENOENT && purpose == Purpose::writing) {
    database.reset(::openat(folder, kFile, O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  }
  if (!database.isValid()) return missing();
  if (::fstat(database.get(), &info) != 0 || !S_ISREG(info.st_mode)) return Found::unusable;
  if ((info.st_mode & 07777) != 0600 && ::fchmod(database.get(), 0600) != 0) return Found::unusable;
  place->fileIs = Identity::of(info);
  return Found::database;
}

int SqliteVoicemailStore::open(const Place& place, SqliteTimeLimit& limit) {
  database_ = std::make_unique<Database>();
  database_->folderIs = place.folderIs;
  database_->fileIs = place.fileIs;
  database_->folder.reset(::fcntl(place.folder, F_DUPFD_CLOEXEC, 0));
  const int code = database_->folder.isValid()
                       ? database_->open(pathInHeldFolder(database_->folder.get(), kFile), limit)
                       : SQLITE_CANTOPEN;
  if (code != SQLITE_OK) database_.reset();
  return code;
}

// A database that is open already may have been changed below (its tables dropped, its bytes written over),
// so a failure counts only with one that was opened for this operation.
int SqliteVoicemailStore::run(const Place& place, SqliteTimeLimit& limit, const char* statement,
                              const std::string* first, const std::string* second,
                              std::optional<std::string>* result) {
  int code = SQLITE_OK;
  if (database_ != nullptr) {
    code = database_->run(limit, statement, first, second, result);
    if (code == SQLITE_OK) return code;
    database_.reset();
    if (limit.isOver()) return code;
  }
  code = open(place, limit);
  if (code == SQLITE_OK) code = database_->run(limit, statement, first, second, result);
  if (code != SQLITE_OK) database_.reset();
  return code;
}

// Nothing in it can be read any more; a person may still want to look at it, so an earlier one stays, too.
bool SqliteVoicemailStore::moveAside(const Place& place) {
  int error = 0;
  for (int number = 0; number < kMaxMovedAside; ++number) {
    std::string name = std::string(kFile) + ".damaged";
    if (number > 0) name += "." + std::to_string(number);
    if (renameToFreeName(place.folder, kFile, name.c_str()) == 0) {
      logUnified(LogLevel::error, "The voicemail store is damaged; moved aside to %s", name.c_str());
      return true;
    }
    error = errno;
    if (error != EEXIST) break;
  }
  logUnified(LogLevel::error, "The voicemail store is damaged and cannot be moved aside (%s)",
             describeError(error));
  return false;
}

// Runs `work`, which returns a code of SQLite. Logs a failure, and throws the lack of memory.
template <typename Work>
void SqliteVoicemailStore::perform(Purpose purpose, const Work& work) {
  int code = SQLITE_NOMEM;
  try {
    code = work();
  } catch (const std::bad_alloc&) {
    // Told like one of SQLite's own.
  }
  if (code != SQLITE_OK && purpose == Purpose::writing)
    logUnified(LogLevel::error, "The voicemail store could not be written");
  else if (code != SQLITE_OK)
    logUnified(LogLevel::error, "The voicemail store could not be read");
  if (isLackOfMemory(code)) throw std::bad_alloc();
}

void SqliteVoicemailStore::write(const char* statement, const std::string* first, const std::string* second) {
  perform(Purpose::writing, [&] {
    SqliteTimeLimit limit(kPatience, time_);
    int code = SQLITE_CANTOPEN;
    for (int attempt = 0; attempt < 2; ++attempt) {
      Place place;
      if (find(&place, Purpose::writing) != Found::database) break;
      code = run(place, limit, statement, first, second, nullptr);
      if (!isDamage(code) || !moveAside(place)) break;
    }
    return code;
  });
}

std::optional<std::string> SqliteVoicemailStore::read(const char* statement, const std::string* key) {
  std::optional<std::string> token;
  perform(Purpose::reading, [&] {
    SqliteTimeLimit limit(kPatience, time_);
    Place place;
    switch (find(&place, Purpose::reading)) {
      case Found::nothing:
        return SQLITE_OK;
      case Found::unusable:
        return SQLITE_CANTOPEN;
      case Found::database:
        break;
    }
    return run(place, limit, statement, key, nullptr, &token);
  });
  return token;
}

void SqliteVoicemailStore::setToken(const std::string* token) {
  if (token == nullptr) return write("DELETE FROM general", nullptr, nullptr);
  write("INSERT INTO general(id, token) VALUES(0, ?1) ON CONFLICT(id) DO UPDATE SET token = ?1", token,
        nullptr);
}

void SqliteVoicemailStore::setTokenForKey(const std::string& key, const std::string& token) {
  write("INSERT INTO tokens(key, token) VALUES(?1, ?2) ON CONFLICT(key) DO UPDATE SET token = ?2", &key,
        &token);
}

void SqliteVoicemailStore::removeAllRecords() { write("DELETE FROM tokens", nullptr, nullptr); }

std::optional<std::string> SqliteVoicemailStore::copyToken() {
  return read("SELECT token FROM general WHERE id = 0", nullptr);
}

std::optional<std::string> SqliteVoicemailStore::copyTokenForKey(const std::string& key) {
  return read("SELECT token FROM tokens WHERE key = ?1", &key);
}

}  // namespace brenvik
