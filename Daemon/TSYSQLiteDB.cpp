// The connection and what changes the database; reading is in TSYSQLiteDB+Reading.cpp.
#include "Daemon/TSYSQLiteDB.h"

#include "Daemon/TSYException.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYInvariant.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYSQLiteVFS.h"
#include "Platform/os/Platform.h"
#include "Platform/values/PropertyList.h"

using platform::FileDescriptor;

namespace {

constexpr char kFileName[] = "containers.sqlite3";

FileDescriptor openDirectory(const TSYURL& url) {
  auto directory = platform::Platform::current().files.openDirectory(url.path());
  return directory ? std::move(*directory) : FileDescriptor();
}

// Ends a transaction that nobody has ended: whatever went wrong, the next one must find none open.
class NoTransactionLeft {
 public:
  explicit NoTransactionLeft(sqlite3* db) : db_(db) {}
  ~NoTransactionLeft() {
    if (sqlite3_get_autocommit(db_) == 0) sqlite3_exec(db_, "ROLLBACK;", nullptr, nullptr, nullptr);
  }
  NoTransactionLeft(const NoTransactionLeft&) = delete;
  NoTransactionLeft& operator=(const NoTransactionLeft&) = delete;

 private:
  sqlite3* const db_;
};

int withoutHigherBits(uint64_t number) {
  return static_cast<int>(static_cast<uint32_t>(number));
}

}  // namespace

TSYSQLiteDB::TSYSQLiteDB(const TSYURL& parentDirectory)
    : url_(parentDirectory.appending(kFileName)),
      directory_(openDirectory(parentDirectory)),
      db_(openDBWithURL(url_)) {}

TSYSQLiteDB::~TSYSQLiteDB() {
  closeDB();
}

sqlite3* TSYSQLiteDB::openDBWithURL(const TSYURL& url) const {
  const std::string name = fmt::format("/proc/self/fd/{}/{}", directory_.get(), kFileName);
  sqlite3* db = nullptr;
  const int opened = sqlite3_open_v2(name.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE,
                                     TSYSQLiteVFSName());
  if (opened != SQLITE_OK) {
    TSYLogWrite(TSYLogLevelError, "opening {} failed: {}", url.path(), sqlite3_errmsg(db));
    sqlite3_close(db);
    TSYStopProcess(TSYChannel::database, fmt::format("Failed to open database, err = {}", opened));
  }
  char* message = nullptr;
  const int prepared = sqlite3_exec(db, kTSYSQLiteSchema, nullptr, nullptr, &message);
  if (prepared != SQLITE_OK) {
    TSYLogWrite(TSYLogLevelError, "table create for {} failed: {}", url.path(),
                message == nullptr ? sqlite3_errstr(prepared) : message);
    sqlite3_free(message);
    sqlite3_close(db);
    TSYStopProcess(TSYChannel::database,
                   fmt::format("Failed to initialize database, err = {}", prepared));
  }
  TSYLogWrite(TSYLogLevelDebug, "opening {}", url.path());
  return db;
}

void TSYSQLiteDB::closeDB() {
  if (db_ == nullptr) return;
  TSYLogWrite(TSYLogLevelDebug, "closing {}", url_.path());
  for (sqlite3_stmt*& statement : statements_) {
    if (sqlite3_finalize(statement) != SQLITE_OK) {
      TSYLogWrite(TSYLogLevelError, "sqlite3_finalize for {} failed: {}", url_.path(),
                  sqlite3_errmsg(db_));
    }
    statement = nullptr;
  }
  if (const int closed = sqlite3_close(db_); closed != SQLITE_OK) {
    TSYLogWrite(TSYLogLevelError, "sqlite3_close for {} failed: {}", url_.path(), closed);
  }
  db_ = nullptr;
}

// --- Statements and transactions ----------------------------------------------------------------

TSYResult<TSYSQLiteStatement> TSYSQLiteDB::prepare(TSYSQLiteQuery query) {
  sqlite3_stmt*& kept = statements_[static_cast<size_t>(query)];
  if (kept != nullptr) {
    TSY_INVARIANT(sqlite3_stmt_busy(kept) == 0);
    return TSYSQLiteStatement(kept);
  }
  constexpr int kToItsEnd = -1;
  const TSYSQLiteQueryText& text = TSYSQLiteTextOf(query);
  if (sqlite3_prepare_v3(db_, text.sql, kToItsEnd, SQLITE_PREPARE_PERSISTENT, &kept, nullptr) !=
      SQLITE_OK) {
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                                     "sqlite3_prepare({}) for {} failed: {}", text.kind,
                                     url_.path(), sqlite3_errmsg(db_)));
  }
  return TSYSQLiteStatement(kept);
}

TSYResult<TSYSQLiteStatement> TSYSQLiteDB::prepareWithIdentifier(TSYSQLiteQuery query,
                                                                 const std::string& identifier) {
  auto statement = prepare(query);
  if (statement && !statement->bind(1, identifier)) return TSYFailure(bindFailure(identifier));
  return statement;
}

TSYError TSYSQLiteDB::bindFailure(const std::string& identifier) const {
  return TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                        "sqlite3_bind_text for identifier={} at {} failed: {}", identifier,
                        url_.path(), sqlite3_errmsg(db_));
}

TSYError TSYSQLiteDB::stepFailure() const {
  return TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                        "sqlite3_step for {} failed: {}", url_.path(), sqlite3_errmsg(db_));
}

TSYResult<void> TSYSQLiteDB::stepToEnd(TSYSQLiteStatement& statement) const {
  if (statement.step() == SQLITE_DONE) return {};
  return TSYFailure(stepFailure());
}

TSYResult<void> TSYSQLiteDB::_sqliteExec(const char* sql) {
  char* message = nullptr;
  const int result = sqlite3_exec(db_, sql, nullptr, nullptr, &message);
  if (result == SQLITE_OK) return {};
  auto failure =
      TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes, "{} on {} failed: {}", sql,
                     url_.path(), message == nullptr ? sqlite3_errstr(result) : message);
  sqlite3_free(message);
  return TSYFailure(std::move(failure));
}

TSYResult<void> TSYSQLiteDB::inTransaction(const std::function<TSYResult<void>()>& work) {
  const NoTransactionLeft atTheEnd(db_);
  if (const auto begun = _sqliteExec("BEGIN;"); !begun) {
    return TSYFailure(
        TSYErrorCreate(TSYErrorDatabase, begun.error(), TSYLogIt::yes, "failed _sqliteExec begin"));
  }
  const bool isInternalImage = TSYGlobalConfiguration::sharedInstance().isInternalImage();
  const auto done = TSYCatchingExceptionsUnlessInternal(isInternalImage, work);
  if (!done) return rollBack(done.error());
  // A commit that fails is logged and counts as success; who must know reads again.
  if (const auto committed = _sqliteExec("COMMIT;"); !committed) {
    (void)TSYErrorCreate(TSYErrorDatabase, committed.error(), TSYLogIt::yes,
                         "failed _sqliteExec commit");
  }
  return {};
}

TSYResult<void> TSYSQLiteDB::rollBack(TSYError cause) {
  const auto rolledBack = _sqliteExec("ROLLBACK;");
  if (rolledBack) return TSYFailure(std::move(cause));
  return TSYFailure(TSYErrorCreate(TSYErrorDatabase, rolledBack.error(), TSYLogIt::yes,
                                   "failed _sqliteExec rollback"));
}

TSYResult<void> TSYSQLiteDB::checkChanges(TSYSQLiteQuery query, int expected) const {
  const int changes = sqlite3_changes(db_);
  if (expected == kAnyChanges || changes == expected) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorDatabaseChangeCount, std::nullopt, TSYLogIt::no,
                                   "sqlite3_changes for {} in {}: {}, but expecting {}",
                                   TSYSQLiteTextOf(query).sql, url_.path(), changes, expected));
}

TSYResult<void> TSYSQLiteDB::_performTwoParameterQuery(TSYSQLiteQuery query, const std::string& one,
                                                       const std::string* two,
                                                       int expectedChanges) {
  auto statement = prepareWithIdentifier(query, one);
  if (!statement) return TSYFailure(std::move(statement.error()));
  if (two != nullptr && !statement->bind(2, *two)) return TSYFailure(bindFailure(*two));
  if (auto stepped = stepToEnd(*statement); !stepped) return stepped;
  return checkChanges(query, expectedChanges);
}

TSYResult<void> TSYSQLiteDB::_performSingleParameterQuery(TSYSQLiteQuery query,
                                                          const std::string& one,
                                                          int expectedChanges) {
  return _performTwoParameterQuery(query, one, /*two=*/nullptr, expectedChanges);
}

// --- Adding -------------------------------------------------------------------------------------

TSYResult<void> TSYSQLiteDB::addCodeSigningEntry(const TSYCodeSigningEntry& entry,
                                                 const std::string& identifier) {
  return inTransaction([&]() -> TSYResult<void> {
    if (auto written = _insertCodeSigningInfo(entry, identifier); !written) return written;
    if (auto written = _insertCodeSigningData(entry, identifier); !written) return written;
    if (!entry.childBundleIdentifiers) return {};
    for (const std::string& child : *entry.childBundleIdentifiers) {
      const auto added = _insertChildIdentifier(child, identifier);
      if (added) continue;
      auto failure = TSYErrorCreate(TSYErrorDatabase, added.error(), TSYLogIt::yes,
                                    "Error performing INSERT operation for child {}", child);
      // Some failures, such as a full disk, have rolled back the rest already.
      if (sqlite3_get_autocommit(db_) != 0) return TSYFailure(std::move(failure));
    }
    return {};
  });
}

TSYResult<void> TSYSQLiteDB::_insertChildIdentifier(const std::string& child,
                                                    const std::string& parent) {
  return _performTwoParameterQuery(TSYSQLiteQuery::insertChild, child, &parent, kAnyChanges);
}

TSYResult<void> TSYSQLiteDB::_insertCodeSigningInfo(const TSYCodeSigningEntry& entry,
                                                    const std::string& identifier) {
  auto updated = _performInsertOrUpdateQuery(TSYSQLiteQuery::updateEntry, entry, identifier,
                                             /*isUpdate=*/true);
  if (updated) return {};
  if (!updated.error().is(TSYErrorDatabaseChangeCount)) {
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, updated.error(), TSYLogIt::yes,
                                     "Error performing UPDATE operation for {}", identifier));
  }
  auto inserted = _performInsertOrUpdateQuery(TSYSQLiteQuery::insertEntry, entry, identifier,
                                              /*isUpdate=*/false);
  if (inserted) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorDatabase, inserted.error(), TSYLogIt::yes,
                                   "Error performing INSERT operation for {}", identifier));
}

TSYResult<void> TSYSQLiteDB::bindEntry(TSYSQLiteStatement& statement,
                                       const TSYCodeSigningEntry& entry,
                                       const std::string& identifier) const {
  const int flags =
      (entry.placeholder ? kPlaceholderFlag : 0) | (entry.advanceCopy ? kAdvanceCopyFlag : 0);
  if (!statement.bind(1, int{entry.invalid})) {
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                                     "sqlite3_bind_int for invalid={:d} at {} failed: {}",
                                     entry.invalid, url_.path(), sqlite3_errmsg(db_)));
  }
  if (!statement.bind(2, flags)) {
    return TSYFailure(TSYErrorCreate(
        TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
        "sqlite3_bind_int for placeholder={:d}, advance_copy={:d} (flags={}) at {} failed: {}",
        entry.placeholder, entry.advanceCopy, flags, url_.path(), sqlite3_errmsg(db_)));
  }
  if (!statement.bind(3, int{entry.registeredByCaller})) {
    return TSYFailure(
        TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                       "sqlite3_bind_int for registered_by_caller={:d} at {} failed: {}",
                       entry.registeredByCaller, url_.path(), sqlite3_errmsg(db_)));
  }
  if (!statement.bind(4, withoutHigherBits(entry.dataContainerClass))) {
    return TSYFailure(
        TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                       "sqlite3_bind_int for data_container_class={} at {} failed: {}",
                       entry.dataContainerClass, url_.path(), sqlite3_errmsg(db_)));
  }
  if (!statement.bind(5, identifier)) {
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                                     "sqlite3_bind_text for code_signing_id={} at {} failed: {}",
                                     identifier, url_.path(), sqlite3_errmsg(db_)));
  }
  return {};
}

TSYResult<void> TSYSQLiteDB::_performInsertOrUpdateQuery(TSYSQLiteQuery query,
                                                         const TSYCodeSigningEntry& entry,
                                                         const std::string& identifier,
                                                         bool isUpdate) {
  auto statement = prepare(query);
  if (!statement) return TSYFailure(std::move(statement.error()));
  if (auto bound = bindEntry(*statement, entry, identifier); !bound) return bound;
  if (auto stepped = stepToEnd(*statement); !stepped) return stepped;
  return checkChanges(query, isUpdate ? 1 : kAnyChanges);
}

TSYResult<void> TSYSQLiteDB::_insertCodeSigningData(const TSYCodeSigningEntry& entry,
                                                    const std::string& identifier) {
  const auto data = platform::writeBinaryPropertyList(
      entry.codeSigningInfo ? platform::Value(*entry.codeSigningInfo) : platform::Value());
  if (!data) {
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                                     "Error serializing code signing info for {}: {}", identifier,
                                     data.error().reason));
  }
  auto statement = prepare(TSYSQLiteQuery::insertData);
  if (!statement) return TSYFailure(std::move(statement.error()));
  if (!statement->bind(1, std::span<const uint8_t>(*data))) {
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                                     "sqlite3_bind_blob64 for codeSigningInfoData at {} failed: {}",
                                     url_.path(), sqlite3_errmsg(db_)));
  }
  if (!statement->bind(2, identifier)) {
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                                     "sqlite3_bind_text for code_signing_id_text={} at {} "
                                     "failed: {}",
                                     identifier, url_.path(), sqlite3_errmsg(db_)));
  }
  return stepToEnd(*statement);
}

// --- Deleting and invalidating ------------------------------------------------------------------

TSYResult<void> TSYSQLiteDB::deleteCodeSigningEntryWithIdentifier(const std::string& identifier) {
  auto deleted = _deleteCodeSigningWithIdentifier(identifier);
  if (deleted) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorDatabase, deleted.error(), TSYLogIt::yes,
                                   "failed to delete from code_signing_info"));
}

TSYResult<void> TSYSQLiteDB::_deleteCodeSigningWithIdentifier(const std::string& identifier) {
  return _performSingleParameterQuery(TSYSQLiteQuery::deleteEntry, identifier,
                                      /*expectedChanges=*/1);
}

TSYResult<void> TSYSQLiteDB::invalidateCodeSigningWithIdentifier(const std::string& identifier) {
  auto invalidated = _performSingleParameterQuery(TSYSQLiteQuery::invalidateEntry, identifier);
  if (invalidated) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorDatabase, invalidated.error(), TSYLogIt::yes,
                                   "failed to invalidate identifier {}", identifier));
}

TSYResult<void> TSYSQLiteDB::invalidateCodeSigningForIdentifierAndAllChildren(
    const std::string& identifier) {
  const auto children = childIdentifiersForParentIdentifier(identifier);
  if (!children && !children.error().is(TSYErrorNotFoundInDatabase)) {
    return TSYFailure(
        TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                       "Error retrieving child bundles ids from DB with identifier {} : {}",
                       identifier, children.error()));
  }
  std::vector<std::string> all{identifier};
  if (children) all.insert(all.end(), children->begin(), children->end());
  return inTransaction([&]() -> TSYResult<void> {
    for (const std::string& child : all) {
      if (const auto invalidated = invalidateCodeSigningWithIdentifier(child); !invalidated) {
        TSYLogWrite(TSYLogLevelError, "Failed to invalidate code signing info for {} child {} : {}",
                    identifier, child, invalidated.error());
      } else {
        TSYLogWrite(TSYLogLevelDebug, "Invalidating code signing info for {} child: {}", identifier,
                    child);
      }
    }
    return {};
  });
}

TSYResult<void> TSYSQLiteDB::deleteAllAdvanceCopiesOfCodeSigningEntries() {
  auto statement = prepare(TSYSQLiteQuery::deleteAdvanceCopies);
  if (!statement) return TSYFailure(std::move(statement.error()));
  if (!statement->bind(1, kAdvanceCopyFlag)) {
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                                     "sqlite3_bind_text for flags={} at {} failed: {}",
                                     kAdvanceCopyFlag, url_.path(), sqlite3_errmsg(db_)));
  }
  if (auto stepped = stepToEnd(*statement); !stepped) return stepped;
  if (const int changes = sqlite3_changes(db_); changes > 0) {
    TSYLogWrite(TSYLogLevelError, "Deleted {} advance copies of code signing info.", changes);
  }
  return {};
}
