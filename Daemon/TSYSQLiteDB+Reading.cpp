// What only reads the database.
#include "Daemon/TSYLog.h"
#include "Daemon/TSYSQLiteDB.h"
#include "Platform/values/PropertyList.h"
#include "Platform/values/Unicode.h"

namespace {

// Stored bytes that are no property list, or none of a dictionary.
constexpr std::string_view kFormattingErrorDomain = "PropertyList";
constexpr uint64_t kFormattingError = 2048;

TSYError formattingError(std::string reason,
                         std::source_location where = std::source_location::current()) {
  return TSYError({.domain = kFormattingErrorDomain,
                   .code = kFormattingError,
                   .description = std::move(reason),
                   .underlying = std::nullopt,
                   .functionName = TSYFunctionName(where),
                   .sourceFileLine = where.line()});
}

}  // namespace

TSYResult<TSYCodeSigningEntry> TSYSQLiteDB::codeSigningEntryWithIdentifier(
    const std::string& identifier) {
  auto entry = _selectCodeSigningEntryWithIdentifier(identifier);
  if (!entry) {
    if (!entry.error().is(TSYErrorNotFoundInDatabase)) {
      TSYLogWrite(TSYLogLevelError, "Error retrieving code signing entry: {}", entry.error());
    }
    return entry;
  }
  if (auto added = addChildren(*entry, identifier); !added) {
    TSYLogWrite(TSYLogLevelError, "Error retrieving childBundleIds: {}", added.error());
    return TSYFailure(std::move(added.error()));
  }
  return entry;
}

TSYResult<TSYCodeSigningEntry> TSYSQLiteDB::_selectCodeSigningEntryWithIdentifier(
    const std::string& identifier) {
  auto row = prepareWithIdentifier(TSYSQLiteQuery::selectEntry, identifier);
  if (!row) return TSYFailure(std::move(row.error()));
  switch (row->step()) {
    case SQLITE_ROW:
      return _codeSigningEntryFromStatementRow(*row);
    case SQLITE_DONE:
      return TSYFailure(TSYErrorCreate(TSYErrorNotFoundInDatabase, std::nullopt, TSYLogIt::no,
                                       "Identifier: \"{}\" Not Found in DB", identifier));
    default:
      return TSYFailure(stepFailure());
  }
}

TSYResult<TSYCodeSigningEntry> TSYSQLiteDB::_codeSigningEntryFromStatementRow(
    TSYSQLiteStatement& row) {
  const std::span<const uint8_t> bytes = row.bytes(0);
  if (bytes.empty()) {
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                                     "Failed to create code signing entry from statement row"));
  }
  auto info = platform::readPropertyList(bytes);
  if (!info || info->asDictionary() == nullptr) {
    auto reason = info ? fmt::format("a {} in place of a dictionary", info->typeName())
                       : std::move(info.error().reason);
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, formattingError(std::move(reason)),
                                     TSYLogIt::yes, "Error formatting info data from DB"));
  }
  TSYCodeSigningEntry entry(
      std::make_shared<const platform::Value::Dictionary>(std::move(*info->asDictionary())));
  entry.invalid = row.number(1) != 0;
  entry.placeholder = (row.number(2) & kPlaceholderFlag) != 0;
  entry.advanceCopy = (row.number(2) & kAdvanceCopyFlag) != 0;
  entry.registeredByCaller = row.number(3) != 0;
  entry.dataContainerClass = static_cast<uint32_t>(row.number(4));
  return entry;
}

// No children is no failure: the entry then has none.
TSYResult<void> TSYSQLiteDB::addChildren(TSYCodeSigningEntry& entry,
                                         const std::string& identifier) {
  auto children = childIdentifiersForParentIdentifier(identifier);
  if (children) {
    entry.childBundleIdentifiers = std::move(*children);
    return {};
  }
  if (children.error().is(TSYErrorNotFoundInDatabase)) return {};
  return TSYFailure(std::move(children.error()));
}

TSYResult<void> TSYSQLiteDB::forEachText(TSYSQLiteStatement& rows, const TextBlock& take) const {
  for (;;) {
    switch (rows.step()) {
      case SQLITE_ROW:
        if (auto taken = take(rows.text(0)); !taken) return taken;
        break;
      case SQLITE_DONE:
        return {};
      default:
        return TSYFailure(stepFailure());
    }
  }
}

TSYResult<std::vector<std::string>> TSYSQLiteDB::childIdentifiersForParentIdentifier(
    const std::string& parent) {
  auto rows = prepareWithIdentifier(TSYSQLiteQuery::selectChildren, parent);
  if (!rows) return TSYFailure(std::move(rows.error()));
  std::vector<std::string> children;
  auto read = forEachText(*rows, [&](const char* text) -> TSYResult<void> {
    if (text == nullptr) return {};
    if (!platform::isUTF8(text)) {
      return TSYFailure(TSYErrorCreate(TSYErrorAllocationFailed, std::nullopt, TSYLogIt::yes,
                                       "Failed to allocate thisChildBundleId for text: {}", text));
    }
    children.emplace_back(text);
    return {};
  });
  if (!read) return TSYFailure(std::move(read.error()));
  if (!children.empty()) return children;
  return TSYFailure(TSYErrorCreate(TSYErrorNotFoundInDatabase, std::nullopt, TSYLogIt::no,
                                   "Children for parent identifier: \"{}\" Not Found in DB",
                                   parent));
}

TSYResult<std::string> TSYSQLiteDB::parentIdentifierForChildIdentifier(const std::string& child) {
  auto rows = prepareWithIdentifier(TSYSQLiteQuery::selectParent, child);
  if (!rows) return TSYFailure(std::move(rows.error()));
  std::optional<std::string> parent;
  auto read = forEachText(*rows, [&](const char* text) -> TSYResult<void> {
    if (text == nullptr) return {};
    if (!platform::isUTF8(text)) {
      return TSYFailure(TSYErrorCreate(TSYErrorAllocationFailed, std::nullopt, TSYLogIt::yes,
                                       "Failed to allocate parentIdentifier for text: {}", text));
    }
    parent = text;
    return {};
  });
  if (!read) return TSYFailure(std::move(read.error()));
  if (parent) return std::move(*parent);
  return TSYFailure(TSYErrorCreate(TSYErrorNotFoundInDatabase, std::nullopt, TSYLogIt::no,
                                   "Parent identifier for: \"{}\" Not Found in DB", child));
}

TSYResult<std::vector<std::string>> TSYSQLiteDB::identifiers() {
  auto rows = prepare(TSYSQLiteQuery::selectIdentifiers);
  if (!rows) return TSYFailure(std::move(rows.error()));
  std::vector<std::string> identifiers;
  auto read = forEachText(*rows, [&](const char* text) -> TSYResult<void> {
    if (text == nullptr) {
      TSYLogWrite(TSYLogLevelError, "Error retrieving code_signing_id_text from DB");
      return {};
    }
    if (!platform::isUTF8(text)) {
      return TSYFailure(TSYErrorCreate(TSYErrorAllocationFailed, std::nullopt, TSYLogIt::yes,
                                       "Failed to allocate identifier for text: {}", text));
    }
    identifiers.emplace_back(text);
    return {};
  });
  if (!read && identifiers.empty()) return TSYFailure(std::move(read.error()));
  return identifiers;
}

TSYResult<void> TSYSQLiteDB::enumerateIdentifiersAndCodeSigningInfoUsingBlock(
    const EntryBlock& block) {
  auto rows = prepare(TSYSQLiteQuery::selectAll);
  if (!rows) return TSYFailure(std::move(rows.error()));
  TSYResult<void> result;
  for (;;) {
    const int step = rows->step();
    if (step == SQLITE_DONE) return result;
    if (step != SQLITE_ROW) return TSYFailure(stepFailure());
    auto read = enumerateRow(*rows, block);
    if (read) continue;
    const bool isTheEnd = read.error().is(TSYErrorAllocationFailed);
    result = std::move(read);
    if (isTheEnd) return result;
  }
}

TSYResult<void> TSYSQLiteDB::enumerateRow(TSYSQLiteStatement& row, const EntryBlock& block) {
  auto entry = _codeSigningEntryFromStatementRow(row);
  if (!entry) return TSYFailure(std::move(entry.error()));
  const char* text = row.text(5);
  if (text == nullptr) {
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                                     "Error retrieving code_signing_id_text from DB"));
  }
  if (!platform::isUTF8(text)) {
    return TSYFailure(TSYErrorCreate(TSYErrorAllocationFailed, std::nullopt, TSYLogIt::yes,
                                     "Failed to allocate identifier for text: {}", text));
  }
  const std::string identifier = text;
  if (const auto added = addChildren(*entry, identifier); !added) {
    return TSYFailure(TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                                     "Error retrieving childBundleIds: {}", added.error()));
  }
  block(identifier, *entry);
  return {};
}
