#include "Daemon/TSYSQLiteDB.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::Value;
using testing::ElementsAre;
using testing::UnorderedElementsAre;

using Children = std::optional<std::vector<std::string>>;

TSYCodeSigningEntry entryOf(const std::string& content, Children children = std::nullopt) {
  TSYCodeSigningEntry entry(
      std::make_shared<const Value::Dictionary>(Value::Dictionary{{"content", content}}));
  entry.childBundleIdentifiers = std::move(children);
  return entry;
}

class TSYSQLiteDBTest : public ::testing::Test {
 protected:
  TSYSQLiteDBTest() { reopen(); }

  TSYSQLiteDB& db() { return *db_; }
  void reopen() {
    db_.reset();
    db_ = std::make_unique<TSYSQLiteDB>(TSYURL(device_.path("/library")));
  }
  void add(const std::string& identifier, const TSYCodeSigningEntry& entry) {
    ASSERT_TRUE(db_->addCodeSigningEntry(entry, identifier).has_value()) << identifier;
  }
  TSYCodeSigningEntry entry(const std::string& identifier) {
    auto read = db_->codeSigningEntryWithIdentifier(identifier);
    EXPECT_TRUE(read.has_value()) << identifier;
    return read ? *read : TSYCodeSigningEntry();
  }
  void execute(const std::string& sql) {
    ASSERT_EQ(sqlite3_exec(db_->db(), sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sql;
  }
  // The first column of every row.
  std::vector<std::string> texts(const std::string& sql) {
    std::vector<std::string> all;
    sqlite3_exec(
        db_->db(), sql.c_str(),
        [](void* list, int, char** values, char**) {
          static_cast<std::vector<std::string>*>(list)->push_back(values[0] ? values[0] : "NULL");
          return 0;
        },
        &all, nullptr);
    return all;
  }

  // A longer path than SQLite takes by itself.
  static std::string longPath() {
    return "/" + std::string(200, 'a') + "/" + std::string(200, 'b');
  }

  ContainerDevice device_{std::nullopt, {{"/library/.keep", ""}}};
  std::unique_ptr<TSYSQLiteDB> db_;
};

TEST_F(TSYSQLiteDBTest, anEntryIsReadAsItWasWrittenAlsoByALaterRun) {
  TSYCodeSigningEntry full =
      entryOf("'); DROP TABLE code_signing_info; --", Children({"plugin.b", "plugin.a"}));
  full.invalid = full.placeholder = full.advanceCopy = full.registeredByCaller = true;
  full.dataContainerClass = 13;
  const TSYCodeSigningEntry plain = entryOf(std::string(8 << 20, 'x'));
  const std::string odd = "\"com.example\\'%s'; --\xC3\xA4";
  add(odd, full);
  add("plain", plain);
  reopen();
  EXPECT_EQ(entry(odd), full);
  EXPECT_EQ(entry("plain"), plain) << "and no empty list of children";
  EXPECT_EQ(texts("SELECT placeholder FROM code_signing_info ORDER BY id;"),
            (std::vector<std::string>{"3", "0"}));
  EXPECT_THAT(db().identifiers().value(), UnorderedElementsAre(odd, "plain"));
  EXPECT_EQ(TSYCodeSigningEntry::fromSerializedDictionary(full.serialize()), full);
  EXPECT_EQ(full.hash(), entry(odd).hash());
  EXPECT_NE(full, plain);

  std::map<std::string, TSYCodeSigningEntry> all;
  EXPECT_TRUE(db().enumerateIdentifiersAndCodeSigningInfoUsingBlock(
                      [&](const auto& identifier, const auto& each) { all[identifier] = each; })
                  .has_value());
  EXPECT_EQ(all, (std::map<std::string, TSYCodeSigningEntry>{{odd, full}, {"plain", plain}}));
}

TEST_F(TSYSQLiteDBTest, anEntryThatIsWrittenAgainKeepsItsRowAndItsChildren) {
  add("other", entryOf("other", Children({"moves", "stays"})));
  add("app", entryOf("first", Children({"one", "moves"})));
  EXPECT_EQ(entry("other").childBundleIdentifiers, Children({"stays"}));
  EXPECT_EQ(db().parentIdentifierForChildIdentifier("moves").value(), "app");
  const auto row = texts("SELECT id FROM code_signing_info WHERE code_signing_id_text='app';");

  add("app", entryOf("second"));
  EXPECT_EQ(texts("SELECT id FROM code_signing_info WHERE code_signing_id_text='app';"), row);
  EXPECT_EQ(entry("app"), entryOf("second", Children({"one", "moves"})));
  EXPECT_EQ(texts("SELECT count(*) FROM code_signing_data;"), std::vector<std::string>{"2"});

  EXPECT_TRUE(db().invalidateCodeSigningForIdentifierAndAllChildren("app").has_value());
  EXPECT_TRUE(db().invalidateCodeSigningWithIdentifier("unknown").has_value());
  EXPECT_EQ(texts("SELECT invalid FROM code_signing_info ORDER BY id;"),
            (std::vector<std::string>{"0", "1"}));
}

TEST_F(TSYSQLiteDBTest, whatBelongsToAnEntryGoesWithIt) {
  TSYCodeSigningEntry advance = entryOf("early", Children({"early.plugin"}));
  advance.placeholder = advance.advanceCopy = true;
  TSYCodeSigningEntry placeholder = entryOf("placeholder");
  placeholder.placeholder = true;
  add("early", advance);
  add("placeholder", placeholder);
  add("app", entryOf("app", Children({"plugin"})));
  EXPECT_TRUE(db().deleteAllAdvanceCopiesOfCodeSigningEntries().has_value());
  EXPECT_THAT(db().identifiers().value(), UnorderedElementsAre("placeholder", "app"));
  EXPECT_EQ(device_.countInLog("Deleted 1 advance copies of code signing info."), 1U);
  EXPECT_TRUE(db().deleteCodeSigningEntryWithIdentifier("app").has_value());
  EXPECT_THAT(texts("SELECT child_code_signing_id_text FROM child_bundles;"), testing::IsEmpty());
  EXPECT_EQ(texts("SELECT count(*) FROM code_signing_data;"), std::vector<std::string>{"1"});

  const auto missing = db().deleteCodeSigningEntryWithIdentifier("app");
  expectFailure(missing, 66, "failed to delete from code_signing_info");
  EXPECT_TRUE(missing.error().underlying()->is(TSYErrorDatabaseChangeCount));
  expectFailure(db().codeSigningEntryWithIdentifier("app"), 67,
                "Identifier: \"app\" Not Found in DB");
  expectFailure(db().parentIdentifierForChildIdentifier("plugin"), 67, "plugin");
  EXPECT_EQ(device_.countInLog("Not Found in DB"), 0U) << "no line in the log";
}

// Whatever stands in the file: a code, no crash, and the rest stays readable.
TEST_F(TSYSQLiteDBTest, damagedRowsAreReportedAndPassedOver) {
  for (const char* identifier :
       {"good", "number", "noList", "array", "empty", "noData", "family"}) {
    add(identifier, entryOf(identifier, identifier == std::string("family") ? Children({"child"})
                                                                            : std::nullopt));
  }
  const auto setData = [&](const std::string& identifier, const std::string& data) {
    execute("UPDATE code_signing_data SET data=" + data +
            " WHERE cs_info_id=(SELECT id FROM code_signing_info WHERE code_signing_id_text='" +
            identifier + "');");
  };
  const auto array = platform::writeBinaryPropertyList(Value::Array{"text"}).value();
  setData("number", "5");
  setData("noList", "x'62706c69737430300102'");
  setData("array", fmt::format("x'{:02x}'", fmt::join(array, "")));
  setData("empty", "x''");
  execute(
      "DELETE FROM code_signing_data WHERE cs_info_id=(SELECT id FROM code_signing_info WHERE "
      "code_signing_id_text='noData');");
  execute("UPDATE child_bundles SET child_code_signing_id_text=CAST(x'ff' AS TEXT);");

  for (const char* identifier : {"noList", "array"}) {
    const auto read = db().codeSigningEntryWithIdentifier(identifier);
    expectFailure(read, 66, "Error formatting info data from DB");
    EXPECT_EQ(read.error().underlying()->code(), 2048U) << identifier;
  }
  for (const char* identifier : {"empty", "number"}) {
    expectFailure(db().codeSigningEntryWithIdentifier(identifier), 66,
                  "Failed to create code signing entry from statement row");
  }
  expectFailure(db().codeSigningEntryWithIdentifier("noData"), 67, "noData");
  expectFailure(db().codeSigningEntryWithIdentifier("family"), 73, "thisChildBundleId");

  std::vector<std::string> seen;
  EXPECT_FALSE(db().enumerateIdentifiersAndCodeSigningInfoUsingBlock(
                       [&](const auto& identifier, const auto&) { seen.push_back(identifier); })
                   .has_value());
  EXPECT_THAT(seen, ElementsAre("good"));
  add("good", entryOf("still writable"));
  execute(
      "DELETE FROM code_signing_info WHERE code_signing_id_text!='good'; UPDATE "
      "code_signing_info SET code_signing_id_text=CAST(x'ff' AS TEXT);");
  expectFailure(db().identifiers(), 73, "Failed to allocate identifier");
}

// A statement that fails leaves nothing half done, and the connection usable.
TEST_F(TSYSQLiteDBTest, whatFailsIsRolledBack) {
  add("app", entryOf("before"));
  execute(
      "CREATE TRIGGER refuse BEFORE INSERT ON code_signing_data BEGIN SELECT RAISE(ABORT, "
      "'no room'); END;");
  TSYCodeSigningEntry changed = entryOf("after");
  changed.placeholder = true;
  expectFailure(db().addCodeSigningEntry(changed, "app"), 66, "no room");
  expectFailure(db().addCodeSigningEntry(changed, "new"), 66, "no room");
  execute("DROP TRIGGER refuse;");
  EXPECT_EQ(entry("app"), entryOf("before"));
  EXPECT_THAT(db().identifiers().value(), ElementsAre("app"));

  TSYCodeSigningEntry unwritable(std::make_shared<const Value::Dictionary>(
      Value::Dictionary{{"uuid", platform::UUID::random()}}));
  expectFailure(db().addCodeSigningEntry(unwritable, "app"), 66, "Error serializing");
  EXPECT_EQ(entry("app"), entryOf("before"));
}

TEST_F(TSYSQLiteDBTest, worksBelowARootOfAnyLength) {
  const std::string far = longPath() + longPath();
  device_.write(far + "/.keep", "");
  {
    TSYSQLiteDB distant((TSYURL(device_.path(far))));
    ASSERT_TRUE(distant.addCodeSigningEntry(entryOf("far"), "app").has_value());
    EXPECT_THAT(device_.namesIn(far),
                UnorderedElementsAre(".keep", "containers.sqlite3", "containers.sqlite3-wal"));
  }
  TSYSQLiteDB again((TSYURL(device_.path(far))));
  EXPECT_EQ(again.codeSigningEntryWithIdentifier("app").value(), entryOf("far"));
}

}  // namespace
