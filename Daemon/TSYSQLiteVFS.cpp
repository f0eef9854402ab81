// Two things differ from SQLite's own virtual file system. The name of a database is taken as it
// is: SQLite would resolve it, and refuse a path of over 512 bytes. And statement journals stay in
// memory instead of files outside the root.
#include "Daemon/TSYSQLiteVFS.h"

#include <sqlite3.h>

namespace {

constexpr char kName[] = "tessaryd";

int takeAsItIs(sqlite3_vfs* /*vfs*/, const char* name, int size, char* fullName) {
  sqlite3_snprintf(size, fullName, "%s", name);
  return SQLITE_OK;
}

bool registerVFS() {
  constexpr int kNever = -1;
  if (sqlite3_config(SQLITE_CONFIG_STMTJRNL_SPILL, kNever) != SQLITE_OK) return false;
  const sqlite3_vfs* own = sqlite3_vfs_find(nullptr);
  if (own == nullptr) return false;
  static sqlite3_vfs vfs = *own;
  vfs.zName = kName;
  vfs.pNext = nullptr;
  vfs.xFullPathname = takeAsItIs;
  return sqlite3_vfs_register(&vfs, /*makeDflt=*/0) == SQLITE_OK;
}

}  // namespace

const char* TSYSQLiteVFSName() {
  // One that cannot be registered is unknown to SQLite, which then says so.
  [[maybe_unused]] static const bool isRegistered = registerVFS();
  return kName;
}
