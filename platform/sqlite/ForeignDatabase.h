// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <chrono>

#include "platform/sqlite/Sqlite.h"
#include "platform/sqlite/SqliteTime.h"

namespace brenvik {

// Limits the total time of all work with a database, counted from construction: waiting for the locks of
// other programs and running statements, with any triggers and expressions that the database's owner has put
// there. After that, waiting ends with SQLITE_BUSY and a running statement with SQLITE_INTERRUPT. Reading and
// writing pages below a statement (above all, rolling back a transaction) is not limited, so leave time for
// that.
class SqliteTimeLimit {
 public:
  SqliteTimeLimit(std::chrono::milliseconds whole, SqliteTime time);
  SqliteTimeLimit(const SqliteTimeLimit&) = delete;
  SqliteTimeLimit& operator=(const SqliteTimeLimit&) = delete;

  bool isOver() const noexcept { return time_.now() >= end_; }

  // Applies the limit until the connection is closed or lift() is called. The object must live that long.
  void applyTo(sqlite3* database) noexcept;
  // Removes the limit, for work that must complete even when it is late: rolling back a transaction.
  static void lift(sqlite3* database) noexcept;

 private:
  static int isInterrupted(void* limit) noexcept;
  static int waitsOn(void* limit, int turn) noexcept;

  const SqliteTime time_;
  const std::chrono::nanoseconds end_;
};

// For a connection just opened to a database that another account may write: nothing in its schema is
// trusted, and no text or blob in it is longer than kLongestForeignValue. (The heap of SQLite is limited for
// the process, see sqlite().)
void distrustDatabase(sqlite3* database) noexcept;

// Bytes. Far more than any token, channel identifier or schema text; and the slowest function that a hostile
// trigger could call on texts of this length takes some ten milliseconds.
inline constexpr int kLongestForeignValue = 64 << 10;

}  // namespace brenvik
