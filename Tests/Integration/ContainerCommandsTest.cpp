// The commands that delete, replace, empty, describe and measure existing containers, as clients
// send them to the running daemon.
#include <fcntl.h>
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>

#include "Platform/base/FileDescriptor.h"
#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/SanitizedBuild.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/Integration/Watchdog.h"

namespace fs = std::filesystem;
using platform::FileDescriptor;
using platform::UUID;
using platform::Value;
using platform::ipc::Message;
using tessary::Client;
using tessary::Container;
using tessary::ContainerName;

namespace {

constexpr uint64_t kSuccess = 1;
constexpr char kApplication[] = "com.example.app";
const Creation kRegular{2, kApplication};
const Creation kTransient{2, kApplication, /*transient=*/true};

ContainerName nameOf(const Container& container, uint64_t containerClass) {
  return {container.identifier, containerClass, container.uuid, container.personaUniqueString};
}

void write(const std::string& path, const std::string& bytes) {
  std::ofstream(path, std::ios::binary) << bytes;
}

class ContainerCommands : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root";
    startOn("");
  }

  // On a device below `parent`.
  void startOn(const std::string& parent) {
    client_.reset();
    device_.emplace(parent);
    device_->start();
    connectAs(privilegedCaller().with("deleteContainerContent").with("userManagedAssets"));
  }

  void connectAs(const Caller& caller) { client_.emplace(device_->connect(caller)); }

  void restart() {
    client_.reset();
    device_->stop();
    device_->start();
    connectAs(privilegedCaller().with("deleteContainerContent").with("userManagedAssets"));
  }

  Container create(const Creation& creation) {
    auto made = creation.request(*client_);
    if (!made) throw std::runtime_error(made.error().text);
    return std::move(*made);
  }
  Container create(uint64_t containerClass, const std::string& identifier) {
    return create(Creation{containerClass, identifier});
  }

  uint64_t code(uint64_t command, Value::Dictionary request) {
    return codeOf(client_->call(command, Message(std::move(request))));
  }

  std::optional<Device> device_;
  std::optional<Client> client_;
};

TEST_F(ContainerCommands, DeletingTakesAContainerOutOfSight) {
  const Container container = create(kRegular);
  const Container group = create(13, "systemgroup.com.veltra.palette");
  EXPECT_EQ(codeOf(client_->deleteContainer(kApplication, 2, /*transient=*/true)), 21U);
  EXPECT_EQ(codeOf(client_->deleteContainer(kApplication, 2)), kSuccess);
  EXPECT_FALSE(fs::exists(container.path));
  EXPECT_EQ(codeOf(kRegular.lookUp(*client_)), 21U);
  EXPECT_EQ(codeOf(client_->deleteContainer(kApplication, 2)), 21U);
  // Twice, of a name that stays the same, without emptying in between.
  for (int round = 0; round < 2; ++round) {
    EXPECT_EQ(codeOf(client_->deleteContainer(group.identifier, 13)), kSuccess);
    EXPECT_FALSE(fs::exists(group.path));
    EXPECT_EQ(create(13, group.identifier).path, group.path);
  }
  EXPECT_EQ(itemsIn(*device_, kDeathRow).size(), 3U);
  EXPECT_EQ(codeOf(client_->emptyDeathRow()), kSuccess);
  EXPECT_TRUE(itemsIn(*device_, kDeathRow).empty());

  EXPECT_EQ(code(10, {{"ContainerClass", 2}}), 18U);
  EXPECT_EQ(code(10, {{"ContainerClass", 14}, {"Identifier", kApplication}}), 20U);
  // One whose directory somebody else has taken away.
  fs::remove_all(create(kRegular).path);
  EXPECT_EQ(codeOf(client_->deleteContainer(kApplication, 2)), 44U);
  EXPECT_FALSE(create(kRegular).existed);
}

TEST_F(ContainerCommands, StagingTakesTheVeryContainersThatAreNamed) {
  const Container first = create(kRegular);
  const Container second = create(12, "com.example.service");
  const Container kept = create(2, "com.example.kept");
  ContainerName unknown = nameOf(kept, 2);
  unknown.uuid = UUID::random();
  fs::remove_all(second.path);
  EXPECT_EQ(codeOf(client_->stageForDelete({nameOf(first, 2), unknown, nameOf(second, 12)})),
            kSuccess);
  EXPECT_FALSE(fs::exists(first.path));
  EXPECT_FALSE(create(12, "com.example.service").existed);
  EXPECT_TRUE(create(2, "com.example.kept").existed);

  const Value::Array classes{2};
  const Value::Array uuids{kept.uuid};
  const Value::Array identifiers{"com.example.kept"};
  const auto stage = [&](Value::Array classesArray, Value::Array uuidsArray,
                         Value::Array identifiersArray, Value::Array personas) {
    return code(3, {{"ContainerClassesArray", std::move(classesArray)},
                    {"UUIDsArray", std::move(uuidsArray)},
                    {"IdentifiersArray", std::move(identifiersArray)},
                    {"PersonaUniqueStringsArray", std::move(personas)}});
  };
  EXPECT_EQ(stage(classes, uuids, identifiers, {}), 38U);
  EXPECT_EQ(stage(classes, {"no UUID"}, identifiers, {""}), 11U);
  EXPECT_EQ(stage({14}, uuids, identifiers, {""}), 11U);
  EXPECT_EQ(stage(classes, uuids, {5}, {""}), 18U);
  EXPECT_EQ(code(3, {}), kSuccess) << "none at all";
  EXPECT_TRUE(create(2, "com.example.kept").existed);
}

// What resists is moved out of the way, and does not keep the rest from going.
TEST_F(ContainerCommands, DeathRowIsEmptiedOfWhatResists) {
  const std::string mounted = create(2, "com.example.mounted").path + "/Documents";
  const std::string fast = create(2, "com.example.fast").path + "/Documents/file";
  create(2, "com.example.plain");
  ASSERT_EQ(::mount("none", mounted.c_str(), "tmpfs", 0, nullptr), 0);
  write(mounted + "/inside", "x");
  write(fast, "x");
  const FileDescriptor file(::open(fast.c_str(), O_RDONLY | O_CLOEXEC));
  int flags = FS_IMMUTABLE_FL;
  const bool hasFlags = ::ioctl(file.get(), FS_IOC_SETFLAGS, &flags) == 0;
  for (const char* name : {"com.example.mounted", "com.example.fast", "com.example.plain"}) {
    EXPECT_EQ(codeOf(client_->deleteContainer(name, 2)), kSuccess) << name;
  }
  EXPECT_EQ(codeOf(client_->emptyDeathRow()), kSuccess);
  EXPECT_TRUE(itemsIn(*device_, kDeathRow).empty());
  const auto aside = itemsIn(*device_, "/tmp");
  ASSERT_EQ(aside.size(), 1U) << "the mount alone; flags " << hasFlags;
  EXPECT_TRUE(fs::exists(device_->path("/tmp/" + aside[0] + "/Documents/inside")));
}

TEST_F(ContainerCommands, ReplacingKeepsTheRules) {
  const Container old = create(kRegular);
  const Container replacement = create(kTransient);
  const Container other = create(2, "com.example.other");
  const Container group = create(7, "group.example");
  write(old.path + "/Documents/old", "x");
  write(replacement.path + "/Documents/new", "x");
  const auto replace = [&](const ContainerName& from, const ContainerName& to) {
    return codeOf(client_->replaceContainer(from, to));
  };
  ContainerName unknown = nameOf(old, 2);
  unknown.uuid = UUID::random();
  EXPECT_EQ(replace(nameOf(group, 7), nameOf(replacement, 2)), 23U);
  EXPECT_EQ(replace(unknown, nameOf(replacement, 2)), 21U);
  EXPECT_EQ(replace(nameOf(old, 2), unknown), 21U);
  EXPECT_EQ(replace(nameOf(old, 2), nameOf(old, 2)), 22U);
  EXPECT_EQ(replace(nameOf(old, 2), nameOf(other, 2)), 27U) << "it would stay where it is";
  EXPECT_EQ(codeOf(client_->promoteContainer(nameOf(replacement, 2))), 27U) << "there is one";
  EXPECT_EQ(code(2, {{"OldIdentifier", kApplication}, {"OldContainerClass", 2}}), 18U);
  EXPECT_EQ(code(2, {{"OldIdentifier", kApplication},
                     {"OldContainerClass", 2},
                     {"NewIdentifier", kApplication},
                     {"NewContainerClass", 2}}),
            11U)
      << "no UUID";

  EXPECT_EQ(replace(nameOf(old, 2), nameOf(replacement, 2)), kSuccess);
  const auto found = kRegular.lookUp(*client_);
  ASSERT_TRUE(found);
  EXPECT_EQ(found->uuid, replacement.uuid);
  EXPECT_EQ(fs::path(found->path).filename(), fs::path(replacement.path).filename());
  EXPECT_TRUE(fs::exists(found->path + "/Documents/new"));
  EXPECT_FALSE(fs::exists(old.path) || fs::exists(replacement.path));
  EXPECT_TRUE(client_->containersOfClass(2, /*transient=*/true)->empty());
  EXPECT_EQ(codeOf(client_->deleteContainer(kApplication, 2)), kSuccess);
  const Container alone = create(kTransient);
  EXPECT_EQ(codeOf(client_->promoteContainer(nameOf(alone, 2))), kSuccess);
  EXPECT_EQ(kRegular.lookUp(*client_)->uuid, alone.uuid);
}

TEST_F(ContainerCommands, OfTwoReplacesAtOnceOneWins) {
  constexpr int kRounds = 30;
  auto second = Client::connect(device_->root());
  ASSERT_TRUE(second);
  Container old = create(kRegular);
  for (int round = 0; round < kRounds; ++round) {
    const Container replacement = create(kTransient);
    const ContainerName from = nameOf(old, 2);
    const ContainerName to = nameOf(replacement, 2);
    uint64_t codeOfSecond = 0;
    std::jthread other([&] { codeOfSecond = codeOf(second->replaceContainer(from, to)); });
    const uint64_t codeOfFirst = codeOf(client_->replaceContainer(from, to));
    other.join();
    EXPECT_EQ(std::min(codeOfFirst, codeOfSecond), kSuccess);
    EXPECT_EQ(std::max(codeOfFirst, codeOfSecond), 21U);
    auto found = kRegular.lookUp(*client_);
    ASSERT_TRUE(found);
    EXPECT_EQ(found->uuid, replacement.uuid);
    old = std::move(*found);
  }
  EXPECT_EQ(itemsIn(*device_, kRegular.classDirectory()).size(), 1U);
}

TEST_F(ContainerCommands, AWipedContainerKeepsItsNameAndUUID) {
  const Creation plugin{4, "com.example.plugin"};
  const Container before = create(plugin);
  write(before.path + "/Library/file", "x");
  connectAs(Caller().with("wipeContainer", Value::Array{5, "com.example.plugin"}));
  EXPECT_EQ(codeOf(client_->wipePluginData("com.example.another")), 55U);
  EXPECT_EQ(code(11, {}), 18U);
  EXPECT_EQ(codeOf(client_->wipePluginData("com.example.plugin")), kSuccess);
  restart();
  const auto after = plugin.lookUp(*client_);
  ASSERT_TRUE(after);
  EXPECT_EQ(after->uuid, before.uuid);
  EXPECT_EQ(after->path, before.path);
  EXPECT_TRUE(fs::is_directory(after->path + "/Library"));
  EXPECT_FALSE(fs::exists(after->path + "/Library/file"));

  create(kRegular);
  EXPECT_EQ(codeOf(client_->deleteDataContent(kApplication, 2)), kSuccess);
  EXPECT_EQ(codeOf(client_->deleteDataContent("com.example.none", 2)), 21U);
  EXPECT_EQ(codeOf(client_->deleteDataContent(kApplication, 1)), 11U);
  EXPECT_EQ(codeOf(client_->deleteDataContent(kApplication, 0)), 11U);
}

TEST_F(ContainerCommands, InfoValuesPassThroughUnchanged) {
  const ContainerName name = nameOf(create(kRegular), 2);
  Value nested = "leaf";
  for (int depth = 0; depth < 20; ++depth)
    nested = Value::Dictionary{{"deeper", Value::Array{nested}}};
  const Value::Dictionary values = {
      {"bool", true},
      {"negative", int64_t{INT64_MIN}},
      {"unsigned", uint64_t{UINT64_MAX}},
      {"real", 0.1},
      {"date", platform::Date{-1.5}},
      {"text", "\xC3\xA4 \xF0\x9F\x98\x80"},
      {"data", Value::Data{0, 255}},
      {"empty", Value::Dictionary{}},
      {"emptyArray", Value::Array{}},
      {"nested", nested},
      {"large", Value::Data(4 * 1024 * 1024, 7)},
  };
  for (const auto& [key, value] : values) {
    EXPECT_EQ(codeOf(client_->setInfoValue(name, key, value)), kSuccess) << key;
  }
  for (const bool isRestarted : {false, true}) {
    if (isRestarted) restart();
    for (const auto& [key, value] : values) {
      const auto found = client_->infoValue(name, key);
      ASSERT_TRUE(found) << key;
      EXPECT_TRUE(*found == value) << key;
    }
    EXPECT_EQ(client_->metadata(name, /*infoRequested=*/true)->info, values);
    EXPECT_FALSE(client_->metadata(name, /*infoRequested=*/false)->info);
  }
  EXPECT_EQ(codeOf(client_->setInfoValue(name, "text", std::nullopt)), kSuccess);
  EXPECT_EQ(codeOf(client_->infoValue(name, "text")), 24U);
  for (const Value& without : Value::Array{Value(), UUID::random(), Value::Array{Value()}}) {
    EXPECT_EQ(codeOf(client_->setInfoValue(name, "key", without)), 38U) << without.description();
  }
  // One that does not fit into a metadata file any more leaves the rest as it was.
  EXPECT_EQ(codeOf(client_->setInfoValue(name, "much", Value(Value::Data(13 * 1024 * 1024)))), 34U);
  EXPECT_EQ(codeOf(client_->infoValue(name, "much")), 24U);
  EXPECT_TRUE(*client_->infoValue(name, "bool") == Value(true));
  const Value::Dictionary keyless = {
      {"Identifier", kApplication}, {"ContainerClass", 2}, {"UUID", name.uuid}};
  for (const uint64_t command : {uint64_t{5}, uint64_t{6}}) EXPECT_EQ(code(command, keyless), 38U);
}

TEST_F(ContainerCommands, QueriesAndRepairs) {
  const Container container = create(kRegular);
  const ContainerName name = nameOf(container, 2);
  const Picture whole = pictureOf(container.path);
  write(container.path + "/Library/file", "x");
  fs::remove_all(container.path + "/Documents");
  fs::remove_all(container.path + "/Library/Caches");
  EXPECT_EQ(codeOf(client_->recreateStructure(name)), kSuccess);
  EXPECT_TRUE(fs::exists(container.path + "/Library/file"));
  fs::remove(container.path + "/Library/file");
  EXPECT_EQ(pictureOf(container.path), whole);

  EXPECT_EQ(codeOf(client_->regenerateUUID(name)), kSuccess);
  const auto moved = client_->metadata(name, /*infoRequested=*/false);
  ASSERT_TRUE(moved);
  EXPECT_NE(moved->path, container.path);
  EXPECT_FALSE(moved->transient);
  EXPECT_EQ(pictureOf(moved->path), whole);
  const Container group = create(13, "systemgroup.com.veltra.palette");
  EXPECT_EQ(codeOf(client_->regenerateUUID(nameOf(group, 13))), 11U);
  const Container transient = create(kTransient);
  EXPECT_TRUE(client_->metadata(nameOf(transient, 2), /*infoRequested=*/false)->transient);

  ContainerName unknown = name;
  unknown.uuid = UUID::random();
  EXPECT_EQ(codeOf(client_->metadata(unknown, /*infoRequested=*/false)), 21U);
  EXPECT_EQ(codeOf(client_->recreateStructure(unknown)), 21U);
  EXPECT_EQ(codeOf(client_->regenerateUUID(unknown)), 21U);
  EXPECT_EQ(codeOf(client_->diskUsage(unknown)), 21U);
  EXPECT_EQ(codeOf(client_->infoValue(unknown, "key")), 21U);
  EXPECT_EQ(codeOf(client_->setInfoValue(unknown, "key", Value(1))), 21U);
}

// As du(1) counts: what is allocated, hard links once, without following links.
TEST_F(ContainerCommands, DiskUsageIsWhatIsAllocated) {
  const Container data = create(kRegular);
  const std::string documents = data.path + "/Documents";
  write(documents + "/file", std::string(100'000, 'x'));
  fs::create_hard_link(documents + "/file", documents + "/again");
  fs::create_symlink("/usr", documents + "/link");
  write(documents + "/sparse", "x");
  fs::resize_file(documents + "/sparse", 1ULL << 30U);
  const auto du = [](const std::string& path) {
    return std::stoull(runToEnd({"/usr/bin/du", "-s", "--block-size=1", path}).output);
  };
  EXPECT_EQ(*client_->diskUsage(nameOf(data, 2)), du(data.path));
  // A bundle is measured once.
  const Container bundle = create(1, kApplication);
  const uint64_t once = *client_->diskUsage(nameOf(bundle, 1));
  write(bundle.path + "/code", std::string(100'000, 'x'));
  EXPECT_EQ(*client_->diskUsage(nameOf(bundle, 1)), once);
  EXPECT_GT(du(bundle.path), once);
}

TEST_F(ContainerCommands, DeletingDisturbsNobody) {
  const Watchdog watchdog(*device_);
  constexpr size_t kThreads = 12;
  std::vector<Client> clients;
  for (size_t number = 0; number < kThreads; ++number) {
    auto client = Client::connect(device_->root());
    ASSERT_TRUE(client);
    clients.push_back(std::move(*client));
  }
  std::atomic<bool> over = false;
  std::atomic<size_t> wrong = 0;
  const auto expect = [&](uint64_t code, std::initializer_list<uint64_t> codes) {
    if (std::ranges::find(codes, code) == codes.end()) {
      ++wrong;
      ADD_FAILURE() << code;
    }
  };
  const auto act = [&](size_t number) {
    Client& client = clients[number];
    while (!over && wrong == 0) {
      switch (number % 4) {
        case 0:
          expect(codeOf(client.deleteContainer(kApplication, 2)), {kSuccess, 21});
          break;
        case 1:
          expect(codeOf(kRegular.request(client)), {kSuccess});
          break;
        case 2:
          expect(codeOf(kRegular.lookUp(client)), {kSuccess, 21});
          expect(codeOf(client.containersOfClass(2)), {kSuccess});
          break;
        default: {
          // Two of them replace and wipe the same one.
          expect(codeOf(client.deleteDataContent(kApplication, 2)), {kSuccess, 21});
        }
      }
    }
  };
  {
    std::vector<std::jthread> threads;
    for (size_t number = 0; number < kThreads; ++number) threads.emplace_back(act, number);
    std::this_thread::sleep_for(std::chrono::seconds(2));
    over = true;
  }
  create(kRegular);
  EXPECT_EQ(client_->containersOfClass(2)->size(), 1U);
  EXPECT_EQ(itemsIn(*device_, kRegular.classDirectory()).size(), 1U);
  EXPECT_EQ(codeOf(client_->emptyDeathRow()), kSuccess);
  EXPECT_EQ(litterThatStays(*device_, kRegular), "");
}

TEST_F(ContainerCommands, ManyDeletionsLeaveNoTraceInTheProcess) {
  constexpr int kRounds = 10'000 / (kSanitizedStride * kSanitizedStride);
  startOn(quickParent());
  const auto memory = [&] {
    std::ifstream status(fmt::format("/proc/{}/status", device_->daemonPid()));
    for (std::string line; std::getline(status, line);) {
      if (line.starts_with("RssAnon:")) return std::stoull(line.substr(8));
    }
    return 0ULL;
  };
  const auto descriptors = [&] {
    return std::distance(fs::directory_iterator(fmt::format("/proc/{}/fd", device_->daemonPid())),
                         {});
  };
  const auto round = [&](int count) {
    for (int i = 0; i < count; ++i) {
      const std::string identifier = fmt::format("com.example.app{}", i);
      ASSERT_EQ(codeOf(Creation{2, identifier}.request(*client_)), kSuccess);
      ASSERT_EQ(codeOf(client_->deleteContainer(identifier, 2)), kSuccess);
      if (i % 500 != 499) continue;
      ASSERT_EQ(codeOf(client_->emptyDeathRow()), kSuccess);
    }
  };
  round(kRounds / 5);
  const auto memoryBefore = memory();
  const auto descriptorsBefore = descriptors();
  round(kRounds);
  EXPECT_LE(descriptors(), descriptorsBefore);
  // Allocators keep some; a leak of 100 bytes a deletion would be a megabyte.
  if (kSanitizedStride > 1) return;
  EXPECT_LT(memory(), memoryBefore + 600) << "KiB";
}

}  // namespace
