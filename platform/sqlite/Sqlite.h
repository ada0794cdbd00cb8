// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <memory>

namespace brenvik {

// The functions of SQLite (https://sqlite.org/c3ref/funclist.html) that this system calls, under their own
// names. The library is opened on first use: loading it would add a third of a millisecond to every start of
// the daemon, and most of its lives touch no database. Code that includes this header calls nothing of
// <sqlite3.h> directly; the header's types and constants are free to use.
struct SqliteFunctions {
// clang-format off
#define BRENVIK_SQLITE_FUNCTIONS(each) \
  each(bind_blob) each(bind_double) each(bind_int64) each(bind_null) each(bind_text) each(busy_handler) \
  each(changes) each(clear_bindings) each(close_v2) each(column_blob) each(column_bytes) each(column_count) \
  each(column_double) each(column_int64) each(column_text) each(column_type) each(config) each(db_config) each(errmsg) \
  each(errstr) each(exec) each(extended_errcode) each(extended_result_codes) each(finalize) each(free) \
  each(get_autocommit) each(hard_heap_limit64) each(last_insert_rowid) each(limit) each(memory_highwater) each(open_v2) each(prepare_v3) \
  each(progress_handler) each(reset) each(step) each(total_changes) each(vfs_find)
// clang-format on
// NOLINTNEXTLINE(bugprone-macro-parentheses): a member's name cannot have them
#define BRENVIK_SQLITE_MEMBER(name) decltype(&::sqlite3_##name) name = nullptr;
  BRENVIK_SQLITE_FUNCTIONS(BRENVIK_SQLITE_MEMBER)
#undef BRENVIK_SQLITE_MEMBER
};

// The most memory, in bytes, for all of SQLite's connections of the process: ten times what a remap of
// 100,000 contacts needs. A statement that needs more fails with SQLITE_NOMEM.
inline constexpr std::int64_t kMaxSqliteMemory = std::int64_t{32} << 20;

// Loads the library if it is not loaded yet, and returns its functions, valid for the life of the process.
// Returns null if there is no usable library, or if memory ran out while loading it; *lackedMemory, if given,
// tells the two apart. The next call tries again. Any thread. The library may use kMaxSqliteMemory, and opens
// a pipe without waiting for its other end.
const SqliteFunctions* sqlite(bool* lackedMemory = nullptr) noexcept;

// True if a result code of SQLite, plain or extended, means that memory ran out.
constexpr bool isLackOfMemory(int code) noexcept {
  return (code & 0xFF) == SQLITE_NOMEM || code == SQLITE_IOERR_NOMEM;
}

// Owners of a connection and of a statement. They exist only where sqlite() was not null.
struct SqliteClose {
  void operator()(sqlite3* database) const noexcept { (void)sqlite()->close_v2(database); }
};
struct SqliteFinalize {
  void operator()(sqlite3_stmt* statement) const noexcept { (void)sqlite()->finalize(statement); }
};
using SqliteDatabase = std::unique_ptr<sqlite3, SqliteClose>;
using SqliteStatement = std::unique_ptr<sqlite3_stmt, SqliteFinalize>;

}  // namespace brenvik
