// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/sqlite/Sqlite.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <string>

namespace brenvik {
namespace {

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

}  // namespace
}  // namespace brenvik
