// A prepared statement in the hands of one operation.
//
// The statement itself belongs to the connection, which keeps it for the next time: at the end of
// this object it is reset and forgets its values. Indices of values count from 1, those of columns
// from 0, as SQLite's do. Used by one thread.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <span>
#include <string>

class TSYSQLiteStatement {
 public:
  explicit TSYSQLiteStatement(sqlite3_stmt* statement) : statement_(statement) {}
  ~TSYSQLiteStatement();
  TSYSQLiteStatement(TSYSQLiteStatement&& other) noexcept;
  TSYSQLiteStatement& operator=(TSYSQLiteStatement&&) = delete;

  // Each returns whether SQLite took the value. A text ends at its first NUL.
  [[nodiscard]] bool bind(int index, const std::string& text);
  [[nodiscard]] bool bind(int index, int number);
  // Not copied: the bytes outlive the statement's use.
  [[nodiscard]] bool bind(int index, std::span<const uint8_t> bytes);

  // SQLITE_ROW, SQLITE_DONE or an error.
  int step() { return sqlite3_step(statement_); }

  // What the current row holds, until the next step. Null for NULL.
  const char* text(int column);
  int number(int column) { return sqlite3_column_int(statement_, column); }
  // Empty for what is no blob.
  std::span<const uint8_t> bytes(int column);

 private:
  sqlite3_stmt* statement_;
};
