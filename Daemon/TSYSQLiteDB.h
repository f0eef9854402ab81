// The code-signing entries on disk: one SQLite database file, "containers.sqlite3".
//
// It runs in exclusive locking mode with a write-ahead log, so no other process can use the file
// while the daemon runs, and one killed at any moment opens again with what was committed. A
// statement is prepared when it is first used and kept until the connection is closed.
//
// The object has no lock: only the code-signing mapping uses it, on its queue. Codes are 66, unless
// said otherwise; all but 67 and 68 are logged where they arise.
#pragma once

#include <sqlite3.h>

#include <array>
#include <functional>
#include <string>
#include <vector>

#include "Daemon/TSYCodeSigningEntry.h"
#include "Daemon/TSYError.h"
#include "Daemon/TSYSQLiteQueries.h"
#include "Daemon/TSYSQLiteStatement.h"
#include "Daemon/TSYURL.h"
#include "Platform/base/FileDescriptor.h"

class TSYSQLiteDB {
 public:
  // Opens the file in `parentDirectory`; a missing one is made. A file that cannot be opened, or is
  // no database, ends the process.
  explicit TSYSQLiteDB(const TSYURL& parentDirectory);
  ~TSYSQLiteDB();
  TSYSQLiteDB(const TSYSQLiteDB&) = delete;
  TSYSQLiteDB& operator=(const TSYSQLiteDB&) = delete;

  // For tests. Null once closed.
  sqlite3* db() const { return db_; }
  const TSYURL& url() const { return url_; }
  // Nothing may be asked of the object from then on.
  void closeDB();

  // Writes an entry whole, over one that is there. Its children are added to those the identifier
  // has, and taken away from other parents. All or nothing, but for a child that cannot be added
  // (logged). A commit that fails is logged and counts as success. Code 40 too.
  TSYResult<void> addCodeSigningEntry(const TSYCodeSigningEntry& entry,
                                      const std::string& identifier);
  // Removes an entry and its tie to its children. An unknown identifier fails, with 68 underneath.
  TSYResult<void> deleteCodeSigningEntryWithIdentifier(const std::string& identifier);
  // Code 67 when there is none.
  TSYResult<TSYCodeSigningEntry> codeSigningEntryWithIdentifier(const std::string& identifier);
  // An unknown identifier is success.
  TSYResult<void> invalidateCodeSigningWithIdentifier(const std::string& identifier);
  // One that cannot be invalidated is logged and passed over. Code 40 too.
  TSYResult<void> invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier);

  // Calls `block` with every readable entry; it may not change the database. Returns the last
  // failure: of an entry that had to be passed over, or of what ended the enumeration.
  using EntryBlock =
      std::function<void(const std::string& identifier, const TSYCodeSigningEntry& entry)>;
  TSYResult<void> enumerateIdentifiersAndCodeSigningInfoUsingBlock(const EntryBlock& block);
  // What could be read before a failure counts as success; a failure means that nothing could. Code
  // 73 for text that is no UTF-8, here and below.
  TSYResult<std::vector<std::string>> identifiers();
  // Code 67 when the identifier has none, or is unknown.
  TSYResult<std::vector<std::string>> childIdentifiersForParentIdentifier(
      const std::string& parent);
  // Code 67 when there is none.
  TSYResult<std::string> parentIdentifierForChildIdentifier(const std::string& child);

  // Removes what was registered ahead of installations that never came.
  TSYResult<void> deleteAllAdvanceCopiesOfCodeSigningEntries();

 private:
  // The bits of the column "placeholder".
  static constexpr int kPlaceholderFlag = 1;
  static constexpr int kAdvanceCopyFlag = 2;
  sqlite3* openDBWithURL(const TSYURL& url) const;
  // The error that a failed preparation, step or text binding is reported with.
  TSYError bindFailure(const std::string& identifier) const;
  TSYError stepFailure() const;
  // Ready for its values.
  TSYResult<TSYSQLiteStatement> prepare(TSYSQLiteQuery query);
  TSYResult<TSYSQLiteStatement> prepareWithIdentifier(TSYSQLiteQuery query,
                                                      const std::string& identifier);
  // Steps a statement that answers no rows.
  TSYResult<void> stepToEnd(TSYSQLiteStatement& statement) const;

  TSYResult<void> _sqliteExec(const char* sql);
  // Runs `work` between BEGIN and COMMIT, or ROLLBACK when it fails.
  TSYResult<void> inTransaction(const std::function<TSYResult<void>()>& work);
  TSYResult<void> rollBack(TSYError cause);

  static constexpr int kAnyChanges = -1;
  // Code 68 when the last statement has changed another number of rows.
  TSYResult<void> checkChanges(TSYSQLiteQuery query, int expected) const;
  TSYResult<void> _performTwoParameterQuery(TSYSQLiteQuery query, const std::string& one,
                                            const std::string* two, int expectedChanges);
  TSYResult<void> _performSingleParameterQuery(TSYSQLiteQuery query, const std::string& one,
                                               int expectedChanges = kAnyChanges);
  TSYResult<void> _insertChildIdentifier(const std::string& child, const std::string& parent);
  TSYResult<void> bindEntry(TSYSQLiteStatement& statement, const TSYCodeSigningEntry& entry,
                            const std::string& identifier) const;
  TSYResult<void> _performInsertOrUpdateQuery(TSYSQLiteQuery query,
                                              const TSYCodeSigningEntry& entry,
                                              const std::string& identifier, bool isUpdate);
  TSYResult<void> _insertCodeSigningInfo(const TSYCodeSigningEntry& entry,
                                         const std::string& identifier);
  TSYResult<void> _insertCodeSigningData(const TSYCodeSigningEntry& entry,
                                         const std::string& identifier);
  TSYResult<void> _deleteCodeSigningWithIdentifier(const std::string& identifier);

  static TSYResult<TSYCodeSigningEntry> _codeSigningEntryFromStatementRow(TSYSQLiteStatement& row);
  TSYResult<TSYCodeSigningEntry> _selectCodeSigningEntryWithIdentifier(
      const std::string& identifier);
  TSYResult<void> addChildren(TSYCodeSigningEntry& entry, const std::string& identifier);
  TSYResult<void> enumerateRow(TSYSQLiteStatement& row, const EntryBlock& block);
  // Calls `take` with column 0 of every row, null for NULL, until it fails.
  using TextBlock = std::function<TSYResult<void>(const char* text)>;
  TSYResult<void> forEachText(TSYSQLiteStatement& rows, const TextBlock& take) const;

  const TSYURL url_;
  // SQLite opens its files through it.
  const platform::FileDescriptor directory_;
  sqlite3* db_;
  std::array<sqlite3_stmt*, kTSYSQLiteQueryCount> statements_{};
};
