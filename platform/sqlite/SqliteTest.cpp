// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/sqlite/Sqlite.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <string>

#include "platform/base/UniqueFd.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/sqlite/ForeignDatabase.h"
#include "platform/sqlite/HeldFolder.h"
#include "platform/sqlite/fakes/ManualSqliteTime.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;

bool isMapped() {
  std::ifstream maps("/proc/self/maps");
  for (std::string line; std::getline(maps, line);) {
    if (line.find("libsqlite3") != std::string::npos) return true;
  }
  return false;
}

// Exits with 7 when nothing but the first call loads the library.
[[noreturn]] void loadTheLibrary() {
  if (isMapped()) ::_exit(1);
  if (sqlite() == nullptr) ::_exit(2);
  ::_exit(isMapped() ? 7 : 3);
}

TEST(SqliteDeathTest, TheLibraryIsNotLoadedBeforeItsFirstUse) {
  testing::FLAGS_gtest_death_test_style = "threadsafe";  // a process of its own, which has not loaded it yet
  EXPECT_EXIT(loadTheLibrary(), testing::ExitedWithCode(7), "");
}

TEST(SqliteTest, EveryFunctionIsThereAndTheFirstOnesWork) {
  const SqliteFunctions* const functions = sqlite();
  ASSERT_NE(functions, nullptr);
  EXPECT_EQ(sqlite(), functions);
#define BRENVIK_SQLITE_EXPECT(name) EXPECT_NE(functions->name, nullptr) << #name;
  BRENVIK_SQLITE_FUNCTIONS(BRENVIK_SQLITE_EXPECT)
#undef BRENVIK_SQLITE_EXPECT
  sqlite3* opened = nullptr;
  ASSERT_EQ(functions->open_v2(":memory:", &opened, SQLITE_OPEN_READWRITE, nullptr), SQLITE_OK);
  const SqliteDatabase database(opened);
  sqlite3_stmt* prepared = nullptr;
  ASSERT_EQ(functions->prepare_v3(opened, "SELECT 6 * 7", -1, 0, &prepared, nullptr), SQLITE_OK);
  const SqliteStatement statement(prepared);
  ASSERT_EQ(functions->step(prepared), SQLITE_ROW);
  EXPECT_EQ(functions->column_int64(prepared, 0), 42);
}

TEST(SqliteTest, CodesThatMeanALackOfMemoryAreToldFromOthers) {
  for (const int code : {SQLITE_NOMEM, SQLITE_NOMEM | (1 << 8), SQLITE_IOERR_NOMEM}) {
    EXPECT_TRUE(isLackOfMemory(code)) << code;
  }
  for (const int code : {SQLITE_OK, SQLITE_LOCKED, SQLITE_READONLY, SQLITE_IOERR, SQLITE_IOERR_READ,
                         SQLITE_ROW, SQLITE_DONE}) {
    EXPECT_FALSE(isLackOfMemory(code)) << code;
  }
}

TEST(SqliteTest, AConnectionTakesNoMorePagesThanItNeeds) {
  const TemporaryDirectory folder;
  sqlite3* opened = nullptr;
  ASSERT_EQ(sqlite()->open_v2((folder / "pages.db").c_str(), &opened,
                              SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr),
            SQLITE_OK);
  const SqliteDatabase database(opened);
  const std::int64_t before = sqlite()->memory_highwater(1);
  ASSERT_EQ(sqlite()->exec(opened, "CREATE TABLE one(id INTEGER)", nullptr, nullptr, nullptr), SQLITE_OK);
  constexpr std::int64_t kPages = 8 * 4096;  // less than half of the twenty that it would take at once
  EXPECT_LT(sqlite()->memory_highwater(0), before + kPages);
}

class ForeignDatabaseTest : public testing::Test {
 protected:
  static SqliteDatabase open(const std::string& path) {
    sqlite3* opened = nullptr;
    EXPECT_EQ(sqlite()->open_v2(path.c_str(), &opened, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr),
              SQLITE_OK);
    return SqliteDatabase(opened);
  }
  // "done", or why not.
  static std::string run(const SqliteDatabase& database, const char* statements) {
    const int code = sqlite()->exec(database.get(), statements, nullptr, nullptr, nullptr);
    return code == SQLITE_OK ? "done" : sqlite()->errmsg(database.get());
  }

  static constexpr const char kEndless[] =
      "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n) SELECT count(*) FROM n";
  ManualSqliteTime time;
  SqliteDatabase database = open(":memory:");
};

TEST_F(ForeignDatabaseTest, AnEndlessStatementEndsWithTheTimeLimitAndOnlyIfItApplies) {
  time.perLook = 1ms;
  SqliteTimeLimit limit(1s, time.asTime());
  limit.applyTo(database.get());
  EXPECT_EQ(run(database, kEndless), "interrupted");
  EXPECT_GT(time.now, 1s);
  EXPECT_LT(time.now, 1s + 10ms);
  EXPECT_TRUE(limit.isOver());
  // All statements share the one limit.
  EXPECT_EQ(run(database, kEndless), "interrupted");
  EXPECT_LT(time.now, 1s + 20ms);
  SqliteTimeLimit::lift(database.get());
  EXPECT_EQ(run(database,
                "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n LIMIT 1000) "
                "SELECT count(*) FROM n"),
            "done");
}

TEST_F(ForeignDatabaseTest, ALockIsWaitedForUntilTheTimeIsUpAndNoLonger) {
  const TemporaryDirectory folder;
  const SqliteDatabase holder = open(folder / "held.db");
  const SqliteDatabase waiting = open(folder / "held.db");
  ASSERT_EQ(run(holder, "CREATE TABLE one(id INTEGER); BEGIN EXCLUSIVE"), "done");
  SqliteTime limited = time.asTime();
  int looks = 0;
  limited.now = [&, now = limited.now] {
    if (++looks == 10'000) (void)run(holder, "ROLLBACK");  // who waits without end gets it
    return now();
  };
  SqliteTimeLimit limit(1s, limited);
  limit.applyTo(waiting.get());
  EXPECT_EQ(run(waiting, "BEGIN IMMEDIATE"), "database is locked");
  EXPECT_EQ(time.slept, 1s);
  EXPECT_LT(looks, 10'000);
}

TEST(SqliteTest, AHeldFolderIsTheBeginningOfAPathWhateverLinksThereAre) {
  ASSERT_NE(sqlite(), nullptr);
  const TemporaryDirectory folder;
  folder.directory("inner");
  (void)folder.link("inner/link.db", "file.db");
  const UniqueFd held(::open((folder / "inner").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  std::filesystem::rename(folder / "inner", folder / "moved");
  for (const char* const name : {"link.db", "file.db"}) {
    sqlite3* opened = nullptr;
    EXPECT_EQ(sqlite()->open_v2(pathInHeldFolder(held.get(), name).c_str(), &opened,
                                SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr),
              SQLITE_OK)
        << name;
    const SqliteDatabase database(opened);
    EXPECT_EQ(sqlite()->exec(opened, "CREATE TABLE IF NOT EXISTS one(id INTEGER)", nullptr, nullptr, nullptr),
              SQLITE_OK)
        << name;
  }
  EXPECT_TRUE(std::filesystem::is_regular_file(folder / "moved/file.db"));
}

TEST_F(ForeignDatabaseTest, LooksAtTheClockAreCloseTogether) {
  SqliteTimeLimit limit(1h, {[this] { return ++time.now; }, {}});
  limit.applyTo(database.get());
  EXPECT_EQ(run(database,
                "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n LIMIT 1000) "
                "SELECT hex(zeroblob(i)) FROM n"),
            "done");
  EXPECT_GT(time.now.count(), 100) << "several instructions a row";
}

TEST_F(ForeignDatabaseTest, WhatIsTakenFromASchemaIsNotTrustedAndLongTextsAreNotMade) {
  using CreateFunction = decltype(&::sqlite3_create_function);
  void* const library = ::dlopen("libsqlite3.so.0", RTLD_NOW | RTLD_NOLOAD);
  ASSERT_NE(library, nullptr);
  const auto create = reinterpret_cast<CreateFunction>(::dlsym(library, "sqlite3_create_function"));
  ASSERT_NE(create, nullptr);
  static int calls = 0;
  ASSERT_EQ(create(
                database.get(), "application", 0, SQLITE_UTF8, nullptr,
                [](sqlite3_context*, int, sqlite3_value**) { ++calls; }, nullptr, nullptr),
            SQLITE_OK);
  ASSERT_EQ(run(database, "CREATE VIEW v AS SELECT application()"), "done");
  EXPECT_EQ(run(database, "SELECT * FROM v; SELECT length(zeroblob(70000))"), "done");
  EXPECT_EQ(calls, 1) << "so it is up to the connection";
  distrustDatabase(database.get());
  EXPECT_EQ(run(database, "SELECT * FROM v"), "unsafe use of application()");
  EXPECT_EQ(run(database, "SELECT application()"), "done");
  EXPECT_EQ(calls, 2);
  EXPECT_EQ(run(database, "SELECT length(zeroblob(70000))"), "string or blob too big");
  EXPECT_EQ(run(database, "ATTACH ':memory:' AS other"), "too many attached databases - max 0");
  EXPECT_EQ(run(database, "PRAGMA writable_schema = ON; DELETE FROM sqlite_master"),
            "table sqlite_master may not be modified");
  std::string longStatement = "SELECT 1";
  longStatement.insert(0, 70'000, ' ');
  EXPECT_EQ(run(database, longStatement.c_str()), "string or blob too big");
  (void)::dlclose(library);
}

TEST(SqliteTest, TheMemoryOfAllDatabasesIsLimited) {
  ASSERT_NE(sqlite(), nullptr);
  EXPECT_EQ(sqlite()->hard_heap_limit64(-1), kMaxSqliteMemory);
}

}  // namespace
}  // namespace brenvik
