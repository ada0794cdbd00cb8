// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/contacts/linux/SqliteContacts.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FailingAllocations.h"
#include "platform/base/fakes/FailingCalls.h"
#include "platform/contacts/fakes/InMemoryContacts.h"
#include "platform/sqlite/Sqlite.h"
#include "platform/sqlite/fakes/ManualSqliteTime.h"

extern "C" void* dlopen(const char* file, int mode) {
  if (brenvik::FailingCall::failsNow("dlopen")) return nullptr;
  static const auto real = reinterpret_cast<void* (*)(const char*, int)>(::dlsym(RTLD_NEXT, "dlopen"));
  return real(file, mode);
}

namespace brenvik {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

// A second view of the database, as the contacts application has it.
class Application {
 public:
  explicit Application(const fs::path& path, int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE) {
    sqlite3* opened = nullptr;
    EXPECT_EQ(sqlite()->open_v2(path.c_str(), &opened, flags, nullptr), SQLITE_OK);
    database_.reset(opened);
  }
  void run(const std::string& statements) {
    ASSERT_EQ(sqlite()->exec(database_.get(), statements.c_str(), nullptr, nullptr, nullptr), SQLITE_OK)
        << statements << ": " << sqlite()->errmsg(database_.get());
  }
  // The one number a query gives; -1 when it gives none.
  std::int64_t number(const std::string& query) {
    sqlite3_stmt* prepared = nullptr;
    if (sqlite()->prepare_v3(database_.get(), query.c_str(), -1, 0, &prepared, nullptr) != SQLITE_OK)
      return -1;
    const SqliteStatement statement(prepared);
    return sqlite()->step(prepared) == SQLITE_ROW ? sqlite()->column_int64(prepared, 0) : -1;
  }
  std::int64_t references(const std::string& channel) {
    return number("SELECT count(*) FROM contact_channels WHERE channel_identifier = '" + channel + "'");
  }
  bool isReading = false;

 private:
  SqliteDatabase database_;
};

constexpr char kTable[] =
    "CREATE TABLE contact_channels(contact_id INTEGER NOT NULL, channel_identifier TEXT NOT NULL);";

class SqliteContactsTest : public ::testing::Test {
 protected:
  SqliteContactsTest() {
    std::string name = (fs::temp_directory_path() / "contacts-XXXXXX").string();
    EXPECT_NE(::mkdtemp(name.data()), nullptr);
    home = fs::canonical(name);
    fs::create_directories(database().parent_path());
    folder.reset(::open(database().parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  }
  ~SqliteContactsTest() override { fs::remove_all(home); }

  fs::path database() const { return home / "Library/AddressBook/contacts.db"; }
  void makeDatabase(const std::string& more = "") {
    Application(database())
        .run(std::string(kTable) + "INSERT INTO contact_channels VALUES(1,'old'),(2,'other'),(3,'old');" +
             more);
  }
  SqliteContacts contacts() {
    return SqliteContacts([this] { return folder.get(); }, SqliteContacts::kPatience, time.asTime());
  }
  // The description of the failure, or "success".
  std::string remap(const std::string& from = "old", const std::string& to = "new") {
    const auto manager = contacts().makeChannelManager();
    if (manager == nullptr) return "no manager";
    return remap(*manager, from, to);
  }
  static std::string remap(ContactsChannelManager& manager, const std::string& from, const std::string& to) {
    std::optional<std::string> error;
    const bool done = manager.remapChannelIdentifier(from, to, &error);
    EXPECT_EQ(done, !error.has_value());
    return error.value_or("success");
  }

  fs::path home;
  UniqueFd folder;
  ManualSqliteTime time;
};

TEST_F(SqliteContactsTest, EveryReferenceFollowsItsChannelAndNoOther) {
  makeDatabase();
  EXPECT_EQ(remap(), "success");
  Application application(database());
  EXPECT_EQ(application.number("SELECT group_concat(contact_id || channel_identifier) = '1new,2other,3new' "
                               "FROM contact_channels"),
            1);
}

TEST_F(SqliteContactsTest, TheDatabaseKeepsItsOwnerItsModeAndItsFolderClean) {
  makeDatabase();
  ASSERT_EQ(::chmod(database().c_str(), 0600), 0);
  EXPECT_EQ(remap(), "success");
  struct stat status {};
  ASSERT_EQ(::stat(database().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777U, 0600U);
  EXPECT_EQ(std::distance(fs::directory_iterator(database().parent_path()), fs::directory_iterator()), 1);
}

TEST_F(SqliteContactsTest, AnAnsweredRemapIsHeldFastInItsFolder) {
  makeDatabase();
  // With the journal's name gone, the folder is synced.
  static std::vector<std::string> calls;
  calls.clear();
  sqlite3_vfs* const files = sqlite()->vfs_find(nullptr);
  static const auto realUnlink =
      reinterpret_cast<int (*)(const char*)>(files->xGetSystemCall(files, "unlink"));
  static const auto realOpenDirectory =
      reinterpret_cast<int (*)(const char*, int*)>(files->xGetSystemCall(files, "openDirectory"));
  const auto unlink = +[](const char* path) {
    calls.emplace_back("unlink");
    return realUnlink(path);
  };
  const auto openDirectory = +[](const char* path, int* opened) {
    calls.emplace_back("open folder to sync it");
    return realOpenDirectory(path, opened);
  };
  files->xSetSystemCall(files, "unlink", reinterpret_cast<sqlite3_syscall_ptr>(unlink));
  files->xSetSystemCall(files, "openDirectory", reinterpret_cast<sqlite3_syscall_ptr>(openDirectory));
  EXPECT_EQ(remap(), "success");
  files->xSetSystemCall(files, "unlink", reinterpret_cast<sqlite3_syscall_ptr>(realUnlink));
  files->xSetSystemCall(files, "openDirectory", reinterpret_cast<sqlite3_syscall_ptr>(realOpenDirectory));
  ASSERT_FALSE(calls.empty());
  EXPECT_EQ(std::count(calls.begin(), calls.end(), "unlink"), 1);
  EXPECT_EQ(calls.back(), "open folder to sync it");
}

TEST_F(SqliteContactsTest, IdentifiersAreTextsAndNeverPartOfAStatement) {
  makeDatabase();
  EXPECT_EQ(remap("old", "'; DROP TABLE contact_channels; --"), "success");
  EXPECT_EQ(remap("'; DROP TABLE contact_channels; --", "n\xC3\xA4h"), "success");
  EXPECT_EQ(Application(database()).references("n\xC3\xA4h"), 2);
}

TEST_F(SqliteContactsTest, WithoutAHomeADatabaseOrAReadableOneThereIsNoManager) {
  EXPECT_EQ(SqliteContacts([] { return -1; }).makeChannelManager(), nullptr);
  EXPECT_EQ(remap(), "no manager");
  EXPECT_FALSE(fs::exists(database())) << "a missing database must not be made";
  makeDatabase();
  ASSERT_EQ(::chmod(database().c_str(), 0200), 0);
  EXPECT_EQ(remap(), "no manager");
}

TEST_F(SqliteContactsTest, AFileThatIsNoDatabaseGivesNoManager) {
  std::ofstream(database()) << "short";
  EXPECT_EQ(remap(), "no manager");
  std::ofstream(database()) << std::string(100000, 'x');
  EXPECT_EQ(remap(), "no manager");
  fs::remove(database());
  fs::create_directory(database());
  EXPECT_EQ(remap(), "no manager");
  fs::remove(database());
  ASSERT_EQ(::mkfifo(database().c_str(), 0600), 0);
  EXPECT_EQ(remap(), "no manager");
}

TEST_F(SqliteContactsTest, ALinkInTheDatabasesPlaceIsNotFollowed) {
  makeDatabase();
  fs::rename(database(), home / "elsewhere.db");
  fs::create_symlink(home / "elsewhere.db", database());
  EXPECT_EQ(remap(), "no manager");
}

TEST_F(SqliteContactsTest, TheFolderIsTheOneThatIsOpenWhereverItStands) {
  makeDatabase();
  fs::rename(database().parent_path(), home / "elsewhere");
  EXPECT_EQ(remap(), "success");
  Application application(home / "elsewhere/contacts.db");
  EXPECT_EQ(application.references("new"), 2);
}

TEST_F(SqliteContactsTest, AMissingTableIsAFailureWithItsDescription) {
  Application(database()).run("CREATE TABLE something(x)");
  EXPECT_EQ(remap(), "no such table: contact_channels");
  fs::remove(database());
  std::ofstream(database()).flush();  // an empty file is an empty database
  EXPECT_EQ(remap(), "no such table: contact_channels");
  EXPECT_EQ(fs::file_size(database()), 0U);
}

TEST_F(SqliteContactsTest, ALockedDatabaseIsAFailureWithItsDescriptionAndNothingChanges) {
  makeDatabase();
  Application application(database());
  for (const char* lock : {"BEGIN IMMEDIATE", "BEGIN EXCLUSIVE"}) {
    application.run(lock);
    EXPECT_EQ(remap(), "database is locked") << lock;
    application.run("ROLLBACK");
  }
  EXPECT_EQ(application.references("old"), 2);
  EXPECT_EQ(remap(), "success");
}

TEST_F(SqliteContactsTest, ALockHeldByAReaderAtTheLastMomentUndoesEverything) {
  makeDatabase();
  Application application(database());
  application.run("BEGIN");
  EXPECT_EQ(application.references("old"), 2);  // from here on it holds a shared lock
  EXPECT_EQ(remap(), "database is locked");
  application.run("COMMIT");
  EXPECT_EQ(application.references("old"), 2);
  EXPECT_EQ(remap(), "success");
}

TEST_F(SqliteContactsTest, AReadOnlyDatabaseIsAFailureWithItsDescriptionEvenForRoot) {
  makeDatabase();
  ASSERT_EQ(::chmod(database().c_str(), 0444), 0);
  EXPECT_EQ(remap(), "attempt to write a readonly database");
  EXPECT_EQ(Application(database(), SQLITE_OPEN_READONLY).references("old"), 2);
}

TEST_F(SqliteContactsTest, ACorruptDatabaseIsAFailureWithItsDescription) {
  makeDatabase();
  {
    std::fstream file(database(), std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(4096);  // the table's page; the header and the schema stay whole
    file << std::string(4096, '\xA5');
  }
  EXPECT_EQ(remap(), "database disk image is malformed");
  {
    std::fstream file(database(), std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(100);  // the schema's page
    file << std::string(3000, '\xA5');
  }
  EXPECT_EQ(remap(), "database disk image is malformed");
}

TEST_F(SqliteContactsTest, AFailureAtTheLastRowUndoesTheOthers) {
  makeDatabase(
      "CREATE TRIGGER t BEFORE UPDATE ON contact_channels WHEN old.contact_id = 3 "
      "BEGIN SELECT RAISE(FAIL, 'contact 3 is frozen'); END;");
  EXPECT_EQ(remap(), "contact 3 is frozen");
  EXPECT_EQ(Application(database()).references("old"), 2);
}

TEST_F(SqliteContactsTest, ATriggerThatNeverEndsIsCutOff) {
  makeDatabase(
      "CREATE TRIGGER t AFTER UPDATE ON contact_channels BEGIN "
      "INSERT INTO contact_channels SELECT 1, 'x' WHERE 0 < (WITH RECURSIVE n(i) AS "
      "(SELECT 1 UNION ALL SELECT i + 1 FROM n) SELECT count(*) FROM n); END;");
  time.perLook = 1ms;
  EXPECT_EQ(remap(), "interrupted");
  EXPECT_GE(time.now, SqliteContacts::kPatience);
  EXPECT_LT(time.now, SqliteContacts::kPatience + 100ms);
  EXPECT_EQ(Application(database()).references("old"), 2);
}

TEST_F(SqliteContactsTest, TriggersThatWantAllMemoryAreCutOffBeforeTheyHaveMuch) {
  // Each sets off the next, and meanwhile holds a text of 60 kilobytes.
  constexpr int kTriggers = 800;
  std::string triggers =
      "CREATE TABLE t0(x); CREATE TRIGGER first AFTER UPDATE ON contact_channels "
      "BEGIN INSERT INTO t0 VALUES(hex(zeroblob(30000))); END;";
  for (int i = 0; i < kTriggers; ++i) {
    const std::string number = std::to_string(i);
    const std::string next = "t" + std::to_string(i + 1);
    triggers += "CREATE TABLE " + next + "(x); CREATE TRIGGER r" + number + " AFTER INSERT ON t" + number +
                " BEGIN INSERT INTO " + next + " VALUES(hex(zeroblob(30000))); END;";
  }
  makeDatabase("BEGIN;" + triggers + "COMMIT;");
  (void)sqlite()->memory_highwater(1);
  EXPECT_EQ(remap(), "out of memory");
  EXPECT_LE(sqlite()->memory_highwater(0), kMaxSqliteMemory);
  EXPECT_EQ(Application(database()).references("old"), 2);
}

TEST_F(SqliteContactsTest, ATextLongerThanAnyIdentifierIsNotMade) {
  makeDatabase(
      "CREATE TRIGGER t AFTER UPDATE ON contact_channels BEGIN "
      "INSERT INTO contact_channels VALUES(1, hex(zeroblob(50000))); END;");
  EXPECT_EQ(remap(), "string or blob too big");
  EXPECT_EQ(Application(database()).references("old"), 2);
}

TEST_F(SqliteContactsTest, ASchemaLargerThanTheMemoryAllowedIsALackOfMemoryAndNoMissingDatabase) {
  (void)sqlite()->hard_heap_limit64(0);  // for whoever makes it
  makeDatabase(
      "PRAGMA writable_schema=ON; INSERT INTO sqlite_master WITH RECURSIVE n(i) AS "
      "(SELECT 1 UNION ALL SELECT i + 1 FROM n WHERE i < 1000) SELECT 'view', 'v' || i, 'v' || i, 0, "
      "'CREATE VIEW v' || i || ' AS SELECT ''' || hex(zeroblob(25000)) || ''' AS c' FROM n;");
  (void)sqlite()->hard_heap_limit64(kMaxSqliteMemory);
  (void)sqlite()->memory_highwater(1);
  EXPECT_EQ(remap(), "out of memory");
  EXPECT_LE(sqlite()->memory_highwater(0), kMaxSqliteMemory);
}

TEST_F(SqliteContactsTest, APipeInTheJournalsPlaceKeepsNobodyWaiting) {
  makeDatabase();
  ASSERT_EQ(::mkfifo((database().string() + "-journal").c_str(), 0600), 0);
  EXPECT_NE(remap(), "success");
  fs::remove(database().string() + "-journal");
  EXPECT_EQ(remap(), "success");
}

TEST_F(SqliteContactsTest, AllLocksTogetherAreWaitedForOnlySoLong) {
  makeDatabase();
  Application application(database());
  // Let go just before the patience ends, and taken by a reader: what is left is for the end of the remap.
  application.run("BEGIN EXCLUSIVE");
  SqliteTime lettingGo = time.asTime();
  lettingGo.sleepFor = [&, sleep = lettingGo.sleepFor](std::chrono::nanoseconds forTime) {
    sleep(forTime);
    if (time.slept < SqliteContacts::kPatience - 100ms || application.isReading) return;
    application.run("COMMIT; BEGIN; SELECT * FROM contact_channels");
    application.isReading = true;
  };
  const auto manager = SqliteContacts([this] { return folder.get(); }, SqliteContacts::kPatience, lettingGo)
                           .makeChannelManager();
  ASSERT_NE(manager, nullptr);
  EXPECT_EQ(remap(*manager, "old", "new"), "database is locked");
  EXPECT_GE(time.slept, SqliteContacts::kPatience - 100ms);
  EXPECT_LE(time.slept, SqliteContacts::kPatience);
  application.run("COMMIT");
  EXPECT_EQ(application.references("old"), 2);
}

TEST_F(SqliteContactsTest, AManagerWorksAgainAfterAFailure) {
  makeDatabase(
      "CREATE TRIGGER t BEFORE UPDATE ON contact_channels WHEN new.channel_identifier = 'refused' "
      "BEGIN SELECT RAISE(FAIL, 'refused'); END;");
  const auto manager = contacts().makeChannelManager();
  ASSERT_NE(manager, nullptr);
  EXPECT_EQ(remap(*manager, "old", "refused"), "refused");
  EXPECT_EQ(remap(*manager, "old", "new"), "success");
  EXPECT_EQ(Application(database()).references("new"), 2);
}

// ---- A large remap while another process reads. ----

struct ReaderReport {
  std::int64_t before = 0;  // looks that saw every reference still at the old channel
  std::int64_t after = 0;   // looks that saw every reference at the new one
  std::int64_t mixed = 0;   // looks that saw anything else: must not be
};

// Reads until every reference has moved, or until the writer is gone. In a process of its own.
ReaderReport readUntilMoved(const fs::path& path, std::int64_t rows, int writerIsThere) {
  Application reader(path, SQLITE_OPEN_READWRITE);
  ReaderReport report;
  while (report.after == 0) {
    const std::int64_t sum = reader.number(
        "SELECT sum(channel_identifier = 'old') * 1000000 + sum(channel_identifier = 'new') "
        "FROM contact_channels");
    if (sum == rows * 1000000)
      ++report.before;
    else if (sum == rows)
      ++report.after;
    else if (sum != -1)
      ++report.mixed;  // -1: the writer is writing just now
    char byte = 0;
    // End of file once the writer has closed its end; it does so after its remap, so one last look decides.
    if (report.after == 0 && ::read(writerIsThere, &byte, 1) == 0 && reader.references("new") != rows) break;
  }
  return report;
}

class LargeRemapTest : public SqliteContactsTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(LargeRemapTest, AHundredThousandReferencesMoveAtOnceForAnotherProcessThatReads) {
  constexpr std::int64_t kRows = 100000;
  // The test's process has used SQLite by now in other tests; the reader is forked before this one opens a
  // file.
  Application(database())
      .run(std::string("PRAGMA journal_mode=") + GetParam() + ";" + kTable +
           "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n WHERE i < 100000) "
           "INSERT INTO contact_channels SELECT i, 'old' FROM n;");
  std::array<int, 2> alive{};
  std::array<int, 2> result{};
  std::array<int, 2> started{};
  ASSERT_EQ(::pipe2(alive.data(), O_NONBLOCK | O_CLOEXEC), 0);
  ASSERT_EQ(::pipe2(result.data(), O_CLOEXEC), 0);
  ASSERT_EQ(::pipe2(started.data(), O_CLOEXEC), 0);
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    ::close(alive[1]);
    Application reader(database(), SQLITE_OPEN_READWRITE);
    const bool whole = reader.references("old") == kRows;
    if (!whole || ::write(started[1], "x", 1) != 1) ::_exit(1);
    const ReaderReport report = readUntilMoved(database(), kRows, alive[0]);
    ::_exit(::write(result[1], &report, sizeof report) == sizeof report ? 0 : 1);
  }
  ::close(alive[0]);
  ::close(result[1]);
  ::close(started[1]);
  char byte = 0;
  EXPECT_EQ(::read(started[0], &byte, 1), 1);

  const auto manager = SqliteContacts([this] { return folder.get(); }, 20s).makeChannelManager();
  ASSERT_NE(manager, nullptr);
  EXPECT_EQ(remap(*manager, "old", "new"), "success");
  ::close(alive[1]);

  ReaderReport report;
  EXPECT_EQ(::read(result[0], &report, sizeof report), static_cast<ssize_t>(sizeof report));
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(report.mixed, 0);
  EXPECT_GE(report.after, 1);
  EXPECT_EQ(Application(database()).references("new"), kRows);
  ::close(result[0]);
  ::close(started[0]);
}

INSTANTIATE_TEST_SUITE_P(JournalModes, LargeRemapTest, ::testing::Values("delete", "wal"),
                         [](const auto& mode) { return std::string(mode.param); });

// ---- What every contacts service must do, the fake included. ----

struct Contract {
  virtual ~Contract() = default;
  virtual ContactsService& service() = 0;
  virtual void add(std::int64_t contact, const std::string& channel) = 0;
  virtual std::int64_t references(const std::string& channel) = 0;
  virtual void makeUnreachable() = 0;
};

struct FakeContract : Contract {
  ContactsService& service() override { return contacts; }
  void add(std::int64_t contact, const std::string& channel) override {
    contacts.references.push_back({contact, channel});
  }
  std::int64_t references(const std::string& channel) override {
    return std::ranges::count(contacts.references, channel, &InMemoryContacts::Reference::channel);
  }
  void makeUnreachable() override { contacts.isReachable = false; }
  InMemoryContacts contacts;
};

struct SqliteContract : Contract {
  SqliteContract() {
    std::string name = (fs::temp_directory_path() / "contacts-XXXXXX").string();
    EXPECT_NE(::mkdtemp(name.data()), nullptr);
    home = name;
    fs::create_directories(database().parent_path());
    folder.reset(::open(database().parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    Application(database()).run(kTable);
  }
  ~SqliteContract() override { fs::remove_all(home); }
  fs::path database() const { return home / "Library/AddressBook/contacts.db"; }
  ContactsService& service() override { return contacts; }
  void add(std::int64_t contact, const std::string& channel) override {
    Application(database())
        .run("INSERT INTO contact_channels VALUES(" + std::to_string(contact) + ",'" + channel + "')");
  }
  std::int64_t references(const std::string& channel) override {
    return Application(database()).references(channel);
  }
  void makeUnreachable() override { fs::remove(database()); }
  fs::path home;
  UniqueFd folder;
  SqliteContacts contacts{[this] { return folder.get(); }};
};

template <class T>
class ContactsContractTest : public ::testing::Test {
 protected:
  T contract;
};
using Contracts = ::testing::Types<FakeContract, SqliteContract>;
TYPED_TEST_SUITE(ContactsContractTest, Contracts);

TYPED_TEST(ContactsContractTest, ReferencesMoveAndOthersStay) {
  this->contract.add(1, "a");
  this->contract.add(1, "b");
  this->contract.add(2, "a");
  std::optional<std::string> error;
  const auto manager = this->contract.service().makeChannelManager();
  ASSERT_NE(manager, nullptr);
  EXPECT_TRUE(manager->remapChannelIdentifier("a", "c", &error));
  EXPECT_EQ(error, std::nullopt);
  EXPECT_EQ(this->contract.references("a"), 0);
  EXPECT_EQ(this->contract.references("b"), 1);
  EXPECT_EQ(this->contract.references("c"), 2);
}

TYPED_TEST(ContactsContractTest, NothingToMoveIsASuccess) {
  std::optional<std::string> error;
  const auto manager = this->contract.service().makeChannelManager();
  ASSERT_NE(manager, nullptr);
  EXPECT_TRUE(manager->remapChannelIdentifier("a", "b", &error));
  EXPECT_TRUE(manager->remapChannelIdentifier("", "", &error));
  EXPECT_EQ(error, std::nullopt);
}

TYPED_TEST(ContactsContractTest, ATextThatIsNotUtf8IsAFailureThatChangesNothing) {
  this->contract.add(1, "a");
  const auto manager = this->contract.service().makeChannelManager();
  ASSERT_NE(manager, nullptr);
  for (const auto& [from, to] : {std::pair{"a", "\xFF"}, std::pair{"\xC3", "a"}}) {
    std::optional<std::string> error;
    EXPECT_FALSE(manager->remapChannelIdentifier(from, to, &error));
    EXPECT_TRUE(error.has_value());
  }
  EXPECT_EQ(this->contract.references("a"), 1);
}

TYPED_TEST(ContactsContractTest, UnreachableContactsGiveNoManager) {
  this->contract.makeUnreachable();
  EXPECT_EQ(this->contract.service().makeChannelManager(), nullptr);
}

TEST_F(SqliteContactsTest, ARemapThatLacksMemoryFailsWithoutADescription) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "ThreadSanitizer needs its own operator new";
  makeDatabase();
  const auto manager = contacts().makeChannelManager();
  ASSERT_NE(manager, nullptr);
  std::optional<std::string> error;
  bool done = true;
  {
    const FailingAllocations failing(0);
    done = manager->remapChannelIdentifier("old", "\xFF", &error);
  }
  EXPECT_FALSE(done);
  EXPECT_EQ(error, std::nullopt);
}

TEST_F(SqliteContactsTest, TheFolderMayHaveTheNumberOfStandardInput) {
  makeDatabase();
  const UniqueFd before(::fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, STDERR_FILENO + 1));
  ASSERT_EQ(::dup2(folder.get(), STDIN_FILENO), STDIN_FILENO);
  const auto manager = SqliteContacts([] { return STDIN_FILENO; }).makeChannelManager();
  if (before.isValid())
    EXPECT_EQ(::dup2(before.get(), STDIN_FILENO), STDIN_FILENO);
  else
    ::close(STDIN_FILENO);
  EXPECT_NE(manager, nullptr);
}

TEST_F(SqliteContactsTest, WhatIsNoPlainFileIsNotEvenOpened) {
  ASSERT_EQ(::mkfifo(database().c_str(), 0600), 0);
  const UniqueFd watch(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  ASSERT_GE(::inotify_add_watch(watch.get(), database().c_str(), IN_OPEN), 0);
  EXPECT_EQ(remap(), "no manager");
  std::array<char, 512> event;
  EXPECT_EQ(::read(watch.get(), event.data(), event.size()), -1) << "somebody opened it";
  EXPECT_EQ(errno, EAGAIN);
}

TEST_F(SqliteContactsTest, WithoutTheLibraryThereIsNoManager) {
  std::ofstream(database()) << "a plain file";
  testing::FLAGS_gtest_death_test_style = "threadsafe";  // a process of its own, which has not loaded it yet
  EXPECT_EXIT(
      {
        const FailingCall missing("dlopen", ENOENT, 0, FailingCall::HowOften::always);
        const bool isThere = contacts().makeChannelManager() != nullptr;
        ::_exit(missing.failures() == 1 && !isThere ? 7 : 1);
      },
      testing::ExitedWithCode(7), "");
}

}  // namespace
}  // namespace brenvik
