// What is said to SQLite: the schema of the code-signing database and the statements on it.
#pragma once

#include <cstddef>

// Run at every opening.
extern const char kTSYSQLiteSchema[];

enum class TSYSQLiteQuery : size_t {
  updateEntry,
  insertEntry,
  insertData,
  insertChild,
  deleteEntry,
  invalidateEntry,
  selectEntry,
  selectAll,
  selectIdentifiers,
  selectChildren,
  selectParent,
  deleteAdvanceCopies,
};
inline constexpr size_t kTSYSQLiteQueryCount = 12;

struct TSYSQLiteQueryText {
  const char* sql;
  const char* kind;  // as messages name it: "insert" for whatever changes one identifier
};

const TSYSQLiteQueryText& TSYSQLiteTextOf(TSYSQLiteQuery query);
