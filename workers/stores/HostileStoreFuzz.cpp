// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Databases, journals and write-ahead logs of any content, as the owner of the store's folder may put them
// there, under every operation of both stores. The input changes bytes of a database made here (valid ones,
// one that a crash left with a hot journal, and ones whose schema sets traps) or gives all bytes itself. The
// files stand in memory, and time is manual. No file outside of the folder may be touched, nor left open.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FuzzInput.h"
#include "platform/contacts/linux/SqliteContacts.h"
#include "platform/log/fakes/NoLog.h"
#include "platform/sqlite/ForeignDatabase.h"
#include "platform/sqlite/Sqlite.h"
#include "platform/sqlite/fakes/ManualSqliteTime.h"
#include "platform/voicemail/linux/SqliteVoicemailStore.h"

namespace {

using namespace brenvik;
using namespace std::chrono_literals;

constexpr std::array kSuffixes{"", "-journal", "-wal"};
using Files = std::array<std::string, kSuffixes.size()>;  // the contents by suffix; empty: no file

using Open = int (*)(const char*, int, int);
using Unlink = int (*)(const char*);
Open realOpen = nullptr;
Unlink realUnlink = nullptr;

// A journal may name any file of the machine as its super-journal, to be read and removed. Nothing here may
// depend on what stands there, nor harm it.
bool isOurs(const char* path) { return std::string_view(path).starts_with("/.brenvik-held-folder-"); }
int openOurs(const char* path, int flags, int mode) {
  if (isOurs(path) || (flags & O_DIRECTORY) != 0) return realOpen(path, flags, mode);
  errno = ENOENT;
  return -1;
}
int unlinkOurs(const char* path) {
  if (isOurs(path)) return realUnlink(path);
  errno = ENOENT;
  return -1;
}

// In memory where there is such a place, and gone with the process.
class Folder {
 public:
  Folder() {
    require(::mkdtemp(path_.data()) != nullptr);
    directory_.reset(::open(path_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    require(directory_.isValid());
  }
  ~Folder() { std::filesystem::remove_all(path_); }
  int descriptor() const { return directory_.get(); }
  std::string operator/(const std::string& name) const { return path_ + "/" + name; }

  void write(const std::string& name, const std::string& content) const {
    const UniqueFd file(::openat(descriptor(), name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    require(::write(file.get(), content.data(), content.size()) == static_cast<ssize_t>(content.size()));
  }
  std::string read(const std::string& name) const {
    std::ifstream file(*this / name, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  // Removes everything; only the database's own files may be there.
  void empty(const std::string& database) const {
    for (const auto& entry : std::filesystem::directory_iterator(path_)) {
      require(entry.path().filename().string().starts_with(database));
      std::filesystem::remove(entry.path());
    }
  }

 private:
  std::string path_ = ::access("/dev/shm", W_OK) == 0 ? "/dev/shm/store-XXXXXX" : "/tmp/store-XXXXXX";
  UniqueFd directory_;
};

class Databases {
 public:
  explicit Databases(const Folder& folder) : folder_(folder) {
    constexpr const char* kVoicemail =
        "CREATE TABLE general(id INTEGER PRIMARY KEY CHECK(id = 0), token TEXT NOT NULL);"
        "CREATE TABLE tokens(key TEXT PRIMARY KEY NOT NULL, token TEXT NOT NULL) WITHOUT ROWID;"
        "INSERT INTO general VALUES(0, 'general'); INSERT INTO tokens VALUES('a', 'b'), ('key', 'token');";
    constexpr const char* kContacts =
        "CREATE TABLE contact_channels(contact_id INTEGER NOT NULL, channel_identifier TEXT NOT NULL);"
        "CREATE INDEX by_channel ON contact_channels(channel_identifier);"
        "INSERT INTO contact_channels VALUES(1, 'a'), (2, 'a'), (3, 'key');";
    const std::string both = std::string(kVoicemail) + kContacts;
    all_.emplace_back();  // none
    make("PRAGMA page_size=512;" + both);
    make("PRAGMA page_size=4096;" + both);
    make("PRAGMA page_size=512; PRAGMA encoding='UTF-16be'; PRAGMA auto_vacuum=INCREMENTAL;" + both);
    make("PRAGMA page_size=1024; PRAGMA journal_mode=WAL;" + both);
    // Traps in the schema: endless work, views and triggers in place of tables, values made by expressions.
    make(
        "PRAGMA page_size=512;" + both +
        "CREATE TRIGGER t AFTER UPDATE ON contact_channels BEGIN INSERT INTO contact_channels WITH RECURSIVE "
        "n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n) SELECT i, 'a' FROM n LIMIT 300; END;"
        "CREATE TRIGGER u BEFORE UPDATE ON general BEGIN SELECT RAISE(ABORT, 'no'); END;");
    make(
        "PRAGMA page_size=512; CREATE TABLE base(contact_id, channel_identifier);"
        "CREATE VIEW contact_channels AS SELECT * FROM base;"
        "CREATE TRIGGER t INSTEAD OF UPDATE ON contact_channels BEGIN INSERT INTO base "
        "VALUES(new.contact_id, "
        "hex(zeroblob(20000))); END; INSERT INTO base VALUES(1, 'a');"
        "CREATE VIEW general AS SELECT 0 AS id, hex(zeroblob(1000)) AS token; CREATE VIEW tokens AS SELECT "
        "'a' "
        "AS key, 'b' AS token;");
    make(
        "PRAGMA page_size=512;"
        "CREATE TABLE general(id INTEGER PRIMARY KEY, token AS (printf('%1000d', id)) STORED);"
        "CREATE TABLE tokens(key TEXT PRIMARY KEY CHECK(length(key) < 3), token TEXT COLLATE NOCASE);"
        "CREATE UNIQUE INDEX one ON tokens(lower(token) || upper(key)) WHERE token LIKE '%a%';"
        "CREATE TABLE contact_channels(contact_id INTEGER, channel_identifier TEXT UNIQUE REFERENCES "
        "tokens(key) ON UPDATE CASCADE); INSERT INTO contact_channels VALUES(1, 'a');");
    makeHot(both);
    folder_.empty("made.db");
  }

  const Files& operator[](std::size_t index) const { return all_[index % all_.size()]; }
  std::size_t size() const { return all_.size(); }

 private:
  SqliteDatabase open() const {
    sqlite3* opened = nullptr;
    require(sqlite()->open_v2((folder_ / "made.db").c_str(), &opened,
                              SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr) == SQLITE_OK);
    return SqliteDatabase(opened);
  }
  static void run(const SqliteDatabase& database, const std::string& statements) {
    require(sqlite()->exec(database.get(), statements.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK);
  }
  Files now() const {
    Files files;
    for (std::size_t i = 0; i < kSuffixes.size(); ++i)
      files[i] = folder_.read(std::string("made.db") + kSuffixes[i]);
    return files;
  }
  void make(const std::string& statements) {
    const SqliteDatabase database = open();
    run(database, statements);
    all_.push_back(now());  // with its log, where it has one
    folder_.empty("made.db");
  }
  // As a crash within a transaction leaves it.
  void makeHot(const std::string& statements) {
    const SqliteDatabase database = open();
    run(database, "PRAGMA page_size=512; PRAGMA cache_size=1; PRAGMA cache_spill=1;" + statements);
    run(database,
        "BEGIN; UPDATE general SET token = hex(zeroblob(3000)); UPDATE contact_channels SET "
        "channel_identifier = hex(zeroblob(2000)); DELETE FROM tokens;");
    all_.push_back(now());
    folder_.empty("made.db");
  }

  const Folder& folder_;
  std::vector<Files> all_;
};

struct Machine {
  NoLog log;
  Folder folder;
  std::optional<Databases> databases;
  Machine() {
    setLogSink(&log);
    require(sqlite() != nullptr);
    databases.emplace(folder);
    sqlite3_vfs* const files = sqlite()->vfs_find(nullptr);
    realOpen = reinterpret_cast<Open>(files->xGetSystemCall(files, "open"));
    realUnlink = reinterpret_cast<Unlink>(files->xGetSystemCall(files, "unlink"));
    files->xSetSystemCall(files, "open", reinterpret_cast<sqlite3_syscall_ptr>(&openOurs));
    files->xSetSystemCall(files, "unlink", reinterpret_cast<sqlite3_syscall_ptr>(&unlinkOurs));
  }
};

void patch(FuzzInput& input, std::string& bytes) {
  switch (input.byte() % 8) {
    case 0:  // cut
      bytes.resize(std::min<std::size_t>(bytes.size(), input.number(2)));
      break;
    case 1:  // all bytes from the input
      bytes = input.text(2);
      break;
    case 2:  // longer
      bytes += input.text();
      break;
    default: {
      if (bytes.empty()) break;
      const std::size_t at = input.number(2) % bytes.size();
      const auto with = input.bytes(1 + input.below(8));
      for (std::size_t i = 0; i < with.size() && at + i < bytes.size(); ++i)
        bytes[at + i] = static_cast<char>(with[i]);
    }
  }
}

// An operation may run out of the memory that SQLite is allowed; that is an answer, too.
template <class Work>
void tolerant(Work work) {
  try {
    work();
  } catch (const std::bad_alloc&) {
  }
}

void useVoicemail(FuzzInput& input, const Folder& folder, const SqliteTime& time) {
  SqliteVoicemailStore store([&](SqliteVoicemailStore::Purpose) { return folder.descriptor(); }, time);
  static constexpr std::array kTexts{"a", "key", "", "a longer text, which may take a page of its own"};
  for (int i = 0; i < 6 && !input.isEmpty(); ++i) {
    const std::uint8_t what = input.byte();
    const std::string key = kTexts[what >> 3 & 3U];
    const std::string token(kTexts[what >> 5 & 3U]);
    const auto isBounded = [](const std::optional<std::string>& text) {
      require(!text || text->size() <= kLongestForeignValue);
    };
    tolerant([&] {
      switch (what & 7) {
        case 0:
          store.setToken(&token);
          break;
        case 1:
          store.setToken(nullptr);
          break;
        case 2:
          store.setTokenForKey(key, token);
          break;
        case 3:
          store.removeAllRecords();
          break;
        case 4:
        case 5:
          isBounded(store.copyToken());
          break;
        default:
          isBounded(store.copyTokenForKey(key));
          break;
      }
    });
  }
}

void useContacts(FuzzInput& input, const Folder& folder, const SqliteTime& time) {
  SqliteContacts contacts([&] { return folder.descriptor(); }, SqliteContacts::kPatience, time);
  tolerant([&] {
    const auto manager = contacts.makeChannelManager();
    for (int i = 0; manager != nullptr && i < 2; ++i) {
      std::optional<std::string> error;
      const bool done = manager->remapChannelIdentifier(input.flag() ? "a" : "key", "to", &error);
      require(!done || !error);
    }
  });
}

// One more than the highest open descriptor is enough to see one that was left.
int nextDescriptor() {
  const UniqueFd next(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  return next.get();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const Machine machine;
  FuzzInput input(data, size);
  const int before = nextDescriptor();
  const bool isVoicemail = input.flag();
  const std::string name = isVoicemail ? "voicemail.db" : "contacts.db";
  Files files = (*machine.databases)[input.byte()];
  for (std::size_t patches = input.below(8); patches > 0; --patches)
    patch(input, files[input.byte() % 4 % kSuffixes.size()]);
  for (std::size_t i = 0; i < files.size(); ++i) {
    if (!files[i].empty()) machine.folder.write(name + kSuffixes[i], files[i]);
  }
  ManualSqliteTime time;
  time.perLook = 20ms;  // an endless statement ends after fifty looks
  (isVoicemail ? useVoicemail : useContacts)(input, machine.folder, time.asTime());
  require(nextDescriptor() == before);
  machine.folder.empty(name);
  return 0;
}
