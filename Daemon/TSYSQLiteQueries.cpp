#include "Daemon/TSYSQLiteQueries.h"

#include <array>

// How the file is used, and what it holds. A data row and the rows of children go with their entry.
const char kTSYSQLiteSchema[] =
    "PRAGMA locking_mode = EXCLUSIVE;"
    "PRAGMA journal_mode = WAL;"
    "PRAGMA foreign_keys = ON;"
    "PRAGMA auto_vacuum = FULL;"
    "CREATE TABLE IF NOT EXISTS code_signing_info(id INTEGER PRIMARY KEY AUTOINCREMENT,"
    "code_signing_id_text TEXT NOT NULL UNIQUE,invalid INTEGER NOT NULL DEFAULT 0,"
    "placeholder INTEGER NOT NULL DEFAULT 0,registered_by_caller INTEGER NOT NULL DEFAULT 0,"
    "data_container_class INTEGER NOT NULL DEFAULT 0);"
    "CREATE TABLE IF NOT EXISTS code_signing_data(id INTEGER PRIMARY KEY AUTOINCREMENT,"
    "cs_info_id INTEGER NOT NULL UNIQUE,data BLOB NOT NULL,"
    "FOREIGN KEY(cs_info_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);"
    "CREATE TABLE IF NOT EXISTS child_bundles(id INTEGER PRIMARY KEY AUTOINCREMENT,"
    "child_code_signing_id_text TEXT NOT NULL UNIQUE,parent_id INTEGER NOT NULL,"
    "FOREIGN KEY(parent_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);"
    "CREATE INDEX IF NOT EXISTS code_signing_id_text_idx ON "
    "code_signing_info(code_signing_id_text);"
    "CREATE INDEX IF NOT EXISTS cs_info_id_idx ON code_signing_data(cs_info_id);"
    "CREATE INDEX IF NOT EXISTS parent_id_idx ON child_bundles(parent_id);";

namespace {

// In the order of TSYSQLiteQuery.
constexpr std::array<TSYSQLiteQueryText, kTSYSQLiteQueryCount> kQueries = {{
    {"UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, "
     "data_container_class=? WHERE code_signing_id_text=?;",
     "insert"},
    {"INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, "
     "data_container_class, code_signing_id_text) VALUES (?, ?, ?, ?, ?);",
     "insert"},
    {"INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM "
     "code_signing_info WHERE code_signing_id_text = ?;",
     "insert"},
    {"INSERT OR REPLACE INTO child_bundles (parent_id, child_code_signing_id_text) SELECT id, ? "
     "FROM code_signing_info WHERE code_signing_id_text = ?;",
     "insert"},
    {"DELETE FROM code_signing_info WHERE code_signing_id_text=?;", "insert"},
    {"UPDATE code_signing_info SET invalid=1 WHERE code_signing_id_text = ?;", "insert"},
    {"SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
     "code_signing_info.registered_by_caller, code_signing_info.data_container_class FROM "
     "code_signing_info, code_signing_data WHERE code_signing_info.id = "
     "code_signing_data.cs_info_id AND code_signing_info.code_signing_id_text = ?;",
     "select"},
    {"SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
     "code_signing_info.registered_by_caller, code_signing_info.data_container_class, "
     "code_signing_info.code_signing_id_text FROM code_signing_info, code_signing_data WHERE "
     "code_signing_info.id = code_signing_data.cs_info_id;",
     "select"},
    {"SELECT code_signing_info.code_signing_id_text FROM code_signing_info;", "select"},
    {"SELECT child_bundles.child_code_signing_id_text FROM child_bundles, code_signing_info WHERE "
     "code_signing_info.code_signing_id_text = ? AND child_bundles.parent_id=code_signing_info.id;",
     "select"},
    {"SELECT code_signing_info.code_signing_id_text FROM child_bundles, code_signing_info WHERE "
     "child_bundles.child_code_signing_id_text = ? AND "
     "child_bundles.parent_id=code_signing_info.id;",
     "select"},
    {"DELETE FROM code_signing_info WHERE (placeholder & ?) > 0;", "delete"},
}};

}  // namespace

const TSYSQLiteQueryText& TSYSQLiteTextOf(TSYSQLiteQuery query) {
  return kQueries[static_cast<size_t>(query)];
}
