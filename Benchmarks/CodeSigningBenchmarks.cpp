// The code-signing mapping beside its own statements run bare, on two databases of one schema in
// one process. The bare side binds and steps; it does not read or write a property list.
#include <benchmark/benchmark.h>
#include <fmt/format.h>
#include <sqlite3.h>

#include <filesystem>
#include <memory>

#include "Benchmarks/Samples.h"
#include "Benchmarks/Scratch.h"
#include "Daemon/TSYCodeSigningKeys.h"
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYCommandQueue.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"
#include "Platform/values/PropertyList.h"

namespace {

using platform::Value;

constexpr int kEntries = 10'000;

std::string identifierOf(int number) {
  return fmt::format("com.example.application{}", number);
}

// As many entitlements as an ordinary application has, two groups among them.
Value::Dictionary informationOf(int number) {
  Value::Dictionary entitlements{
      {kTSYEntitlementApplicationGroups,
       Value::Array{fmt::format("group.com.example.{}", number), "group.com.example.all"}}};
  for (int i = 0; i < 10; ++i) entitlements.emplace(fmt::format("com.example.right{}", i), true);
  return {{kTSYCodeSigningEntitlements, std::move(entitlements)}};
}

const Value::Dictionary kApplication{{kTSYOptionDataContainerClass, 2}};

class BareStatement {
 public:
  BareStatement(sqlite3* db, const char* sql) {
    if (sqlite3_prepare_v2(db, sql, -1, &statement_, nullptr) != SQLITE_OK) die(sql);
  }
  ~BareStatement() { sqlite3_finalize(statement_); }
  BareStatement(const BareStatement&) = delete;
  BareStatement& operator=(const BareStatement&) = delete;

  void bind(int index, const std::string& text) {
    sqlite3_bind_text(statement_, index, text.c_str(), -1, SQLITE_TRANSIENT);
  }
  void bind(int index, const Value::Data& bytes) {
    sqlite3_bind_blob64(statement_, index, bytes.data(), bytes.size(), SQLITE_STATIC);
  }
  void bind(int index, int number) { sqlite3_bind_int(statement_, index, number); }
  bool hasRow() { return sqlite3_step(statement_) == SQLITE_ROW; }
  std::string text(int column) {
    return reinterpret_cast<const char*>(sqlite3_column_text(statement_, column));
  }
  void reset() { sqlite3_reset(statement_); }
  void run() {
    while (hasRow()) {
    }
    reset();
  }

 private:
  sqlite3_stmt* statement_ = nullptr;
};

// A copy of the mapping's database, and the statements that the mapping runs on it.
class BareDatabase {
 public:
  explicit BareDatabase(const std::string& path) : db_(open(path)) {}
  ~BareDatabase() { statements_.reset(), sqlite3_close(db_); }
  BareDatabase(const BareDatabase&) = delete;
  BareDatabase& operator=(const BareDatabase&) = delete;

  // What a registration asks and writes.
  void put(const std::string& identifier, const Value::Data& information) {
    statements_->select.bind(1, identifier);
    statements_->select.run();
    statements_->begin.run();
    for (BareStatement* each : {&statements_->update, &statements_->insert}) {
      for (int column = 1; column <= 3; ++column) each->bind(column, 0);
      each->bind(4, 2);
      each->bind(5, identifier);
      each->run();
    }
    statements_->data.bind(1, information);
    statements_->data.bind(2, identifier);
    statements_->data.run();
    statements_->commit.run();
  }
  void read(const std::string& identifier) {
    for (BareStatement* each : {&statements_->select, &statements_->children}) {
      each->bind(1, identifier);
      each->run();
    }
  }
  void enumerate() {
    while (statements_->all.hasRow()) {
      statements_->children.bind(1, statements_->all.text(5));
      statements_->children.run();
    }
    statements_->all.reset();
  }

 private:
  struct Statements {
    explicit Statements(sqlite3* db)
        : begin(db, "BEGIN;"),
          commit(db, "COMMIT;"),
          update(db, TSYSQLiteTextOf(TSYSQLiteQuery::updateEntry).sql),
          insert(db, TSYSQLiteTextOf(TSYSQLiteQuery::insertEntry).sql),
          data(db, TSYSQLiteTextOf(TSYSQLiteQuery::insertData).sql),
          select(db, TSYSQLiteTextOf(TSYSQLiteQuery::selectEntry).sql),
          children(db, TSYSQLiteTextOf(TSYSQLiteQuery::selectChildren).sql),
          all(db, TSYSQLiteTextOf(TSYSQLiteQuery::selectAll).sql) {}
    BareStatement begin;
    BareStatement commit;
    BareStatement update;
    BareStatement insert;
    BareStatement data;
    BareStatement select;
    BareStatement children;
    BareStatement all;
  };

  static sqlite3* open(const std::string& path) {
    sqlite3* db = nullptr;
    if (sqlite3_open(path.c_str(), &db) != SQLITE_OK ||
        sqlite3_exec(db,
                     "PRAGMA locking_mode = EXCLUSIVE; PRAGMA journal_mode = WAL; "
                     "PRAGMA foreign_keys = ON;",
                     nullptr, nullptr, nullptr) != SQLITE_OK) {
      die("cannot open the bare database");
    }
    return db;
  }

  sqlite3* const db_;
  std::unique_ptr<Statements> statements_ = std::make_unique<Statements>(db_);
};

// The mapping with its entries, and the same entries bare.
struct SetUp {
  SetUp() {
    platform::Platform::setCurrent(device->platform());
    (void)TSYLogOpen(scratch.root() + "/bench.log", TSYLogLevelError, {1, 1 << 20});
    const std::string library = scratch.root() + "/mapping";
    std::filesystem::create_directory(library);
    {
      TSYSQLiteDB filled((TSYURL(library)));
      for (int i = 0; i < kEntries; ++i) {
        const auto information = std::make_shared<const Value::Dictionary>(informationOf(i));
        if (!filled.addCodeSigningEntry(TSYCodeSigningEntry(information, 2), identifierOf(i))) {
          die("cannot fill the database");
        }
      }
    }
    const std::string copy = scratch.root() + "/bare.sqlite3";
    std::filesystem::copy_file(library + "/containers.sqlite3", copy);
    mapping.emplace(TSYUserIdentitySharedCache::sharedInstance(),
                    std::make_unique<TSYSQLiteDB>(TSYURL(library)));
    bare.emplace(copy);
  }

  ScratchDevice scratch;
  std::unique_ptr<platform::DevicePlatform> device =
      std::move(platform::DevicePlatform::open(scratch.root()).value());
  std::optional<TSYCodeSigningMapping> mapping;
  std::optional<BareDatabase> bare;
};

// One for all: the process has one platform and one log.
SetUp& setUp() {
  static SetUp instance;
  return instance;
}

void report(benchmark::State& state, Samples& ours, Samples& bare) {
  state.counters["p50_us"] = ours.median();
  state.counters["bare_p50_us"] = bare.median();
  state.counters["ratio_p50"] = ours.median() / bare.median();
}

void registration(benchmark::State& state) {
  constexpr int kRegistrations = 1'000;
  TSYCommandQueue queue;
  for (auto _ : state) {
    Samples ours;
    Samples bare;
    for (int i = kEntries; i < kEntries + kRegistrations; ++i) {
      const std::string identifier = identifierOf(i);
      const auto information = std::make_shared<const Value::Dictionary>(informationOf(i));
      const auto bytes = platform::writeBinaryPropertyList(*information).value();
      ours.time([&] {
        if (setUp().mapping->processCodeSigningInfo(information, identifier, kApplication, queue) !=
            TSYErrorSuccess) {
          die("cannot register");
        }
      });
      bare.time([&] { setUp().bare->put(identifier, bytes); });
    }
    report(state, ours, bare);
  }
}
BENCHMARK(registration)->Iterations(1)->Unit(benchmark::kMillisecond);

// Of so many identifiers by turns: one stays in memory, all of them do not.
void groupLookup(benchmark::State& state) {
  constexpr int kLookups = 20'000;
  const auto identifiers = static_cast<int>(state.range(0));
  for (auto _ : state) {
    Samples ours;
    Samples bare;
    for (int i = 0; i < kLookups; ++i) {
      const std::string identifier = identifierOf(i % identifiers);
      ours.time([&] {
        if (!setUp().mapping->appGroupIdentifiersForIdentifier(identifier)) die("no groups");
      });
      bare.time([&] { setUp().bare->read(identifier); });
    }
    report(state, ours, bare);
  }
}
BENCHMARK(groupLookup)->Arg(1)->Arg(kEntries)->Iterations(1)->Unit(benchmark::kMillisecond);

void referenceCounting(benchmark::State& state) {
  constexpr int kRounds = 10;
  for (auto _ : state) {
    Samples ours;
    Samples bare;
    for (int i = 0; i < kRounds; ++i) {
      ours.time([&] {
        if (!setUp().mapping->copyReferenceCountSetOfType(TSYGroupType::application)) {
          die("no reference counts");
        }
      });
      bare.time([&] { setUp().bare->enumerate(); });
    }
    report(state, ours, bare);
  }
}
BENCHMARK(referenceCounting)->Iterations(1)->Unit(benchmark::kMillisecond);

}  // namespace
