// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/sqlite/ForeignDatabase.h"

#include <algorithm>
#include <thread>
#include <utility>

namespace brenvik {
namespace {

// At the clock, in instructions of SQLite: microseconds apart as a rule, and less than a second where each of
// them is a function that works on the longest texts.
constexpr int kStepsBetweenLooks = 100;

constexpr std::chrono::nanoseconds kFirstPause = std::chrono::milliseconds(1);
constexpr std::chrono::nanoseconds kLongestPause = std::chrono::milliseconds(20);

}  // namespace

SqliteTime SqliteTime::ofTheSystem() {
  return {[] { return std::chrono::steady_clock::now().time_since_epoch(); },
          [](std::chrono::nanoseconds time) { std::this_thread::sleep_for(time); }};
}

SqliteTimeLimit::SqliteTimeLimit(std::chrono::milliseconds whole, SqliteTime time)
    : time_(std::move(time)), end_(time_.now() + whole) {}

void SqliteTimeLimit::applyTo(sqlite3* database) noexcept {
  (void)sqlite()->busy_handler(database, &waitsOn, this);
  sqlite()->progress_handler(database, kStepsBetweenLooks, &isInterrupted, this);
}

void SqliteTimeLimit::lift(sqlite3* database) noexcept {
  (void)sqlite()->busy_handler(database, nullptr, nullptr);
  sqlite()->progress_handler(database, 0, nullptr, nullptr);
}

int SqliteTimeLimit::isInterrupted(void* limit) noexcept {
  return static_cast<const SqliteTimeLimit*>(limit)->isOver() ? 1 : 0;
}

int SqliteTimeLimit::waitsOn(void* limit, int turn) noexcept {
  const auto& self = *static_cast<const SqliteTimeLimit*>(limit);
  const auto left = self.end_ - self.time_.now();
  if (left <= left.zero()) return 0;
  self.time_.sleepFor(std::min({kFirstPause * (1 << std::min(turn, 10)), kLongestPause, left}));
  return 1;
}

void distrustDatabase(sqlite3* database) noexcept {
  const SqliteFunctions& sql = *sqlite();
  (void)sql.db_config(database, SQLITE_DBCONFIG_DEFENSIVE, 1, nullptr);
  (void)sql.db_config(database, SQLITE_DBCONFIG_TRUSTED_SCHEMA, 0, nullptr);
  (void)sql.limit(database, SQLITE_LIMIT_LENGTH, kLongestForeignValue);
  (void)sql.limit(database, SQLITE_LIMIT_SQL_LENGTH, kLongestForeignValue);
  (void)sql.limit(database, SQLITE_LIMIT_ATTACHED, 0);
}

}  // namespace brenvik
