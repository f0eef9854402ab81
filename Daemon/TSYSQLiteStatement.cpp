#include "Daemon/TSYSQLiteStatement.h"

#include <utility>

TSYSQLiteStatement::~TSYSQLiteStatement() {
  if (statement_ == nullptr) return;
  // The last step has told of its failure already.
  (void)sqlite3_reset(statement_);
  (void)sqlite3_clear_bindings(statement_);
}

TSYSQLiteStatement::TSYSQLiteStatement(TSYSQLiteStatement&& other) noexcept
    : statement_(std::exchange(other.statement_, nullptr)) {}

bool TSYSQLiteStatement::bind(int index, const std::string& text) {
  constexpr int kToItsEnd = -1;
  return sqlite3_bind_text(statement_, index, text.c_str(), kToItsEnd, SQLITE_TRANSIENT) ==
         SQLITE_OK;
}

bool TSYSQLiteStatement::bind(int index, int number) {
  return sqlite3_bind_int(statement_, index, number) == SQLITE_OK;
}

bool TSYSQLiteStatement::bind(int index, std::span<const uint8_t> bytes) {
  return sqlite3_bind_blob64(statement_, index, bytes.data(), bytes.size(), SQLITE_STATIC) ==
         SQLITE_OK;
}

const char* TSYSQLiteStatement::text(int column) {
  return reinterpret_cast<const char*>(sqlite3_column_text(statement_, column));
}

std::span<const uint8_t> TSYSQLiteStatement::bytes(int column) {
  if (sqlite3_column_type(statement_, column) != SQLITE_BLOB) return {};
  const auto* first = static_cast<const uint8_t*>(sqlite3_column_blob(statement_, column));
  const int size = sqlite3_column_bytes(statement_, column);
  if (first == nullptr) return {};
  return {first, static_cast<size_t>(size)};
}
