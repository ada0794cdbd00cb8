// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>
#include <utility>

#include "platform/sqlite/Sqlite.h"

namespace brenvik {

// A prepared statement that is run many times. Parameters count from 1, columns from 0; codes are SQLite's.
// The database must outlive it.
class Query {
 public:
  // Resets a statement at the end of the scope, even after an exception.
  class Run {
   public:
    explicit Run(Query& query) noexcept : query_(query) {}
    ~Run() { query_.reset(); }
    Run(const Run&) = delete;
    Run& operator=(const Run&) = delete;

   private:
    Query& query_;
  };

  Query() = default;
  // The object is invalid if SQLite refuses the text.
  Query(const SqliteFunctions& functions, sqlite3* database, std::string_view sql) noexcept
      : sqlite_(&functions) {
    sqlite3_stmt* statement = nullptr;
    (void)functions.prepare_v3(database, sql.data(), static_cast<int>(sql.size()), SQLITE_PREPARE_PERSISTENT,
                               &statement, nullptr);
    statement_.reset(statement);
  }

  bool isValid() const noexcept { return statement_ != nullptr; }
  void bind(int parameter, std::int64_t value) noexcept {
    note(sqlite_->bind_int64(statement_.get(), parameter, value));
  }
  // The text must stay until the statement is reset.
  void bind(int parameter, std::string_view value) noexcept {
    note(sqlite_->bind_text(statement_.get(), parameter, value.data(), static_cast<int>(value.size()),
                            SQLITE_STATIC));
  }
  // Returns SQLITE_ROW, SQLITE_DONE or an error, also the error of an earlier binding or text.
  int step() noexcept { return failure_ != SQLITE_OK ? failure_ : sqlite_->step(statement_.get()); }
  // The error of a binding, or of a text in the last row; SQLITE_OK: none.
  int failure() const noexcept { return failure_; }
  // Makes it ready to run again; the bindings stay.
  void reset() noexcept {
    (void)sqlite_->reset(statement_.get());
    failure_ = SQLITE_OK;
  }

  // These read the current row; views are valid until the next step or reset.
  bool isNull(int column) const noexcept {
    return sqlite_->column_type(statement_.get(), column) == SQLITE_NULL;
  }
  std::int64_t integer(int column) const noexcept { return sqlite_->column_int64(statement_.get(), column); }
  std::string_view text(int column) noexcept {
    const auto* bytes = reinterpret_cast<const char*>(sqlite_->column_text(statement_.get(), column));
    if (bytes == nullptr && !isNull(column)) note(SQLITE_NOMEM);
    return {bytes, bytes == nullptr ? 0 : size(column)};
  }
  std::span<const std::byte> blob(int column) const noexcept {
    const auto* bytes = static_cast<const std::byte*>(sqlite_->column_blob(statement_.get(), column));
    return {bytes, bytes == nullptr ? 0 : size(column)};
  }

 private:
  void note(int code) noexcept {
    if (failure_ == SQLITE_OK) failure_ = code;
  }
  std::size_t size(int column) const noexcept {
    return static_cast<std::size_t>(sqlite_->column_bytes(statement_.get(), column));
  }
  const SqliteFunctions* sqlite_ = nullptr;
  SqliteStatement statement_;
  int failure_ = SQLITE_OK;
};

}  // namespace brenvik
