// Code-signing information as an installer drives it: the life of an application, what survives a
// crash in the middle of a registration, and what strange information does.
#include <fmt/format.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <filesystem>
#include <fstream>
#include <set>

#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/SanitizedBuild.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/Integration/SystemCalls.h"

namespace {

using platform::Value;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::UnorderedElementsAre;
using Dictionary = Value::Dictionary;
using tessary::Client;
using tessary::RegistrationOptions;
using Groups = std::vector<std::string>;

enum Code : uint64_t { kDone = 1, kNotFound = 21, kInvalidArgument = 38, kDatabaseFailed = 66 };

constexpr char kApp[] = "com.example.app";
constexpr char kOther[] = "com.example.other";
constexpr char kGroupsKey[] = "com.veltra.security.application-groups";
constexpr char kSystemGroupsKey[] = "com.veltra.security.system-groups";
constexpr char kDatabase[] = "/private/var/root/Library/Tessary/containers.sqlite3";

Dictionary informationNaming(const Groups& groups, int version = 1) {
  return {{tessary::kEntitlementsKey,
           Dictionary{{kGroupsKey, Value::Array(groups.begin(), groups.end())},
                      {"DataProtectionClass", "complete"}}},
          {"Version", version}};
}

class CodeSigning : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "processes of several users are needed";
    device_.emplace(quickParent());
  }

  Caller installer(const std::optional<std::string>& persona = std::nullopt) const {
    Caller caller = privilegedCaller();
    caller.persona = persona;
    return caller;
  }
  std::set<std::string> groupsOnDisk(Client& client) const {
    std::set<std::string> groups;
    const auto listed = client.containersOfClass(7);
    for (const auto& container : listed.value()) {
      groups.insert(container.identifier);
    }
    return groups;
  }

  std::optional<Device> device_;
};

TEST_F(CodeSigning, TheLifeOfAnApplication) {
  const Device::Persona personal{"P", 100, "personal", "", {kApp}};
  const Device::Persona work{"W", 101, "enterprise", "/private/var/office", {kApp}};
  device_->setPersonas({personal, work});
  device_->start();
  Client client = device_->connect(installer("P"));
  Client atWork = device_->connect(installer("W"));
  const auto put = [&](const char* identifier, const Groups& groups,
                       RegistrationOptions options = {}) {
    ASSERT_EQ(
        codeOf(client.registerCodeSigningInfo(identifier, informationNaming(groups), options)),
        kDone);
  };
  RegistrationOptions plugIn;
  plugIn.dataContainerClass = 4;
  plugIn.parentIdentifier = kApp;

  // Ahead of the installation, and while it lasts, the information is used but not told.
  RegistrationOptions vague;
  for (bool RegistrationOptions::* stage :
       {&RegistrationOptions::advanceCopy, &RegistrationOptions::placeholder}) {
    vague = {};
    vague.*stage = true;
    put(kApp, {"group.a", "group.b"}, vague);
    EXPECT_EQ(codeOf(client.codeSigningInfo(kApp)), kNotFound);
    EXPECT_THAT(client.groupIdentifiers(kApp).value(), UnorderedElementsAre("group.a", "group.b"));
  }

  // Installed. Each persona has group containers of its own.
  const auto bundle = client.createOrLookup(kApp, 1, {.createIfNecessary = true});
  ASSERT_TRUE(bundle.has_value());
  put(kApp, {"group.a", "group.b"}, {.dataContainerClass = 2});
  put("com.example.app.one", {"group.b"}, plugIn);
  put("com.example.app.two", {"group.a"}, plugIn);
  EXPECT_EQ(client.codeSigningInfo(kApp).value(), informationNaming({"group.a", "group.b"}));
  std::set<std::string> paths;
  for (Client* each : {&client, &atWork}) {
    const auto groups = each->groupContainers(kApp);
    for (const auto& group : groups.value()) {
      EXPECT_TRUE(std::filesystem::is_directory(group.path));
      paths.insert(group.path);
    }
  }
  EXPECT_EQ(paths.size(), 4U);

  const auto data = client.createOrLookup(kApp, 2, {.createIfNecessary = true});
  char protectionClass = 0;
  EXPECT_EQ(::getxattr((data->path + "/Documents").c_str(), "trusted.tessary.protection-class",
                       &protectionClass, 1),
            1);
  EXPECT_EQ(protectionClass, '1') << "as the entitlements ask";

  // An update drops a group: first nobody but a plug-in names it, then nobody at all.
  put(kApp, {"group.a"}, {.dataContainerClass = 2});
  EXPECT_EQ(groupsOnDisk(client).size(), 2U);
  put("com.example.app.one", {}, plugIn);
  EXPECT_THAT(groupsOnDisk(client), ElementsAre("group.a"));
  EXPECT_THAT(groupsOnDisk(atWork), ElementsAre("group.a"));

  // A plug-in moves to another application, and stays there when the first one goes invalid.
  put(kOther, {});
  plugIn.parentIdentifier = kOther;
  put("com.example.app.two", {"group.a"}, plugIn);
  const auto newBundle =
      client.createOrLookup(kApp, 1, {.createIfNecessary = true, .transient = true});
  ASSERT_EQ(
      codeOf(client.replaceContainer({kApp, 1, bundle->uuid, {}}, {kApp, 1, newBundle->uuid, {}})),
      kDone);
  EXPECT_EQ(codeOf(client.codeSigningInfo(kApp)), kNotFound);
  EXPECT_EQ(codeOf(client.codeSigningInfo("com.example.app.one")), kNotFound);
  EXPECT_EQ(codeOf(client.codeSigningInfo("com.example.app.two")), kDone);
  EXPECT_EQ(codeOf(client.invalidateCodeSigningInfo()), kDone);
  EXPECT_EQ(codeOf(client.codeSigningInfo(kOther)), kNotFound) << "it has no bundle";
  put(kApp, {"group.a"}, {.dataContainerClass = 2});

  // Removed. What the other application's plug-in names stays until that goes too.
  device_->kill();
  device_->start();
  Client installed = device_->connect(installer("P"));
  EXPECT_EQ(codeOf(installed.deleteContainer(kApp, 1)), kDone);
  EXPECT_EQ(codeOf(installed.codeSigningInfo(kApp)), kNotFound);
  EXPECT_THAT(installed.groupIdentifiers("com.example.app.one").value(), IsEmpty());
  EXPECT_THAT(groupsOnDisk(installed), ElementsAre("group.a"));
  ASSERT_TRUE(installed.createOrLookup(kOther, 1, {.createIfNecessary = true}).has_value());
  EXPECT_EQ(codeOf(installed.deleteContainer(kOther, 1)), kDone);
  EXPECT_THAT(groupsOnDisk(installed), IsEmpty());
  Client workAgain = device_->connect(installer("W"));
  EXPECT_THAT(groupsOnDisk(workAgain), IsEmpty());
}

// --- Crashes ------------------------------------------------------------------------------------

std::string integrityOf(const std::string& path) {
  sqlite3* db = nullptr;
  std::string answer = "cannot be opened";
  if (sqlite3_open(path.c_str(), &db) == SQLITE_OK) {
    const int code = sqlite3_exec(
        db, "PRAGMA integrity_check; PRAGMA foreign_key_check;",
        [](void* text, int, char** values, char**) {
          static_cast<std::string*>(text)->assign(values[0]);
          return 0;
        },
        &answer, nullptr);
    if (code != SQLITE_OK) answer = sqlite3_errmsg(db);
  }
  sqlite3_close(db);
  return answer;
}

// A registration with a tie to a parent, interrupted at each call that it makes.
TEST_F(CodeSigning, ARegistrationThatIsInterruptedIsDoneOrNot) {
  if (const std::string why = whyNotTraceable(); !why.empty()) GTEST_SKIP() << why;
  device_->start();
  const Dictionary before = informationNaming({"group.a"});
  const Dictionary after = informationNaming(Groups(500, "group.b"), /*version=*/2);
  uint64_t code = 0;
  std::optional<Client> client;
  const auto request = [&] {
    RegistrationOptions options;
    options.parentIdentifier = kOther;
    code = codeOf(client->registerCodeSigningInfo(kApp, after, options));
  };
  const auto prepare = [&] {
    client.emplace(device_->connect(installer()));
    ASSERT_EQ(codeOf(client->registerCodeSigningInfo(kOther, before)), kDone);
    ASSERT_EQ(codeOf(client->registerCodeSigningInfo(kApp, std::nullopt)), kDone);
    ASSERT_EQ(codeOf(client->registerCodeSigningInfo(kApp, before)), kDone);
    code = 0;
  };
  const auto restart = [&] {
    client.reset();
    device_->kill();
    EXPECT_EQ(integrityOf(device_->path(kDatabase)), "ok");
    device_->start();
    client.emplace(device_->connect(installer()));
  };
  const auto expectOldOrNew = [&] {
    const auto info = client->codeSigningInfo(kApp);
    ASSERT_TRUE(info.has_value()) << codeOf(info);
    EXPECT_TRUE(*info == before || *info == after);
    EXPECT_EQ(client->codeSigningInfo(kOther).value(), before);
  };
  prepare();
  const auto calls = traceRequest(device_->daemonPid(), request,
                                  [](const FileCall&, size_t) { return Verdict{}; });
  ASSERT_EQ(code, kDone);
  size_t points = 0;
  for (size_t number = 0; number < calls.size() && !HasFailure(); number += kSanitizedStride) {
    for (const auto kind :
         {Verdict::Kind::killBefore, Verdict::Kind::killAfter, Verdict::Kind::fail}) {
      if (kind == Verdict::Kind::killAfter && !calls[number].changes) continue;
      SCOPED_TRACE(fmt::format("call {} ({}), verdict {}", number, calls[number].name,
                               static_cast<int>(kind)));
      prepare();
      traceRequest(device_->daemonPid(), request, [&](const FileCall&, size_t n) {
        return n == number ? Verdict{kind, EIO} : Verdict{};
      });
      ++points;
      if (kind != Verdict::Kind::fail) restart();
      expectOldOrNew();
      if (kind != Verdict::Kind::fail) continue;
      EXPECT_TRUE(code == kDone || code == kDatabaseFailed) << code;
      // A commit whose sync failed may turn out to be in the file all the same.
      restart();
      expectOldOrNew();
    }
  }
  fmt::print("interruptions: {} at {} calls\n", points, calls.size());
  EXPECT_GT(points, 4U);
}

// What a service manager is told by the daemons that the test starts.
class ServiceManagerSocket {
 public:
  explicit ServiceManagerSocket(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    EXPECT_EQ(::bind(socket_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address),
              0);
    ::setenv("NOTIFY_SOCKET", path.c_str(), /*replace=*/1);
  }
  ~ServiceManagerSocket() { ::unsetenv("NOTIFY_SOCKET"); }
  ServiceManagerSocket(const ServiceManagerSocket&) = delete;
  ServiceManagerSocket& operator=(const ServiceManagerSocket&) = delete;

  // Everything since the last call.
  std::string take() {
    std::string all;
    std::array<char, 4096> text{};
    for (ssize_t size = 0;
         (size = ::recv(socket_.get(), text.data(), text.size(), MSG_DONTWAIT)) > 0;) {
      all.append(text.data(), static_cast<size_t>(size));
    }
    return all;
  }

 private:
  const platform::FileDescriptor socket_{::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)};
};

TEST_F(CodeSigning, ADatabaseThatCannotBeUsedEndsTheStart) {
  ServiceManagerSocket serviceManager(device_->root() + "/notify");
  const std::string database = device_->path(kDatabase);
  const std::string log = device_->root() + "/failed.log";
  const auto expectFailedStart = [&](const std::string& words) {
    const pid_t daemon =
        startInBackground({Device::program("tessaryd"), "--root", device_->root()}, log);
    EXPECT_EQ(waitForExit(daemon), EXIT_FAILURE);
    EXPECT_EQ(serviceManager.take(), "") << "it was never ready";
    if (::access("/run/systemd/journal/socket", W_OK) == 0) return;
    EXPECT_NE(contentOf(log).find(words), std::string::npos) << contentOf(log);
  };
  std::filesystem::create_directories(database);
  expectFailedStart("Failed to open database, err = 14");
  std::filesystem::remove(database);
  std::ofstream(database) << std::string(10'000, 'x');
  expectFailedStart("Failed to initialize database, err = 26");
  std::filesystem::remove(database);
  device_->start();
  Client client = device_->connect(installer());
  std::string told;
  EXPECT_TRUE(becomes([&] {
    told += serviceManager.take();
    return told.find("READY=1") != std::string::npos;
  })) << told;
  EXPECT_EQ(codeOf(client.registerCodeSigningInfo(kApp, informationNaming({}))), kDone);
  EXPECT_EQ(device_->stop(), EXIT_SUCCESS);
  EXPECT_FALSE(std::filesystem::exists(database + "-wal")) << "the file is whole by itself";
  EXPECT_EQ(integrityOf(database), "ok");
}

// --- Strange information ------------------------------------------------------------------------

TEST_F(CodeSigning, StrangeInformationStaysInItsPlace) {
  device_->start();
  Client client = device_->connect(installer());
  const Groups names = {"../../escape",
                        "a/b",
                        "'; DROP TABLE code_signing_info; --",
                        "\"quoted\"",
                        std::string(4000, 'n'),
                        "",
                        "."};
  for (const std::string& name : names) {
    SCOPED_TRACE(name.substr(0, 40));
    ASSERT_EQ(codeOf(client.registerCodeSigningInfo(name, informationNaming({name}))), kDone);
    EXPECT_EQ(client.codeSigningInfo(name).value(), informationNaming({name}));
    const auto groups = client.groupContainers(name);
    ASSERT_TRUE(groups.has_value());
    ASSERT_EQ(groups->size(), 1U);
    EXPECT_EQ(std::filesystem::path(groups->front().path).parent_path(),
              device_->path("/private/var/mobile/Containers/Shared/AppGroup"));
  }
  EXPECT_EQ(groupsOnDisk(client).size(), names.size());

  const Dictionary large{{"blob", Value::Data(8 << 20, 0xAA)}};
  EXPECT_EQ(codeOf(client.registerCodeSigningInfo(kApp, large)), kDone);
  EXPECT_EQ(client.codeSigningInfo(kApp).value(), large);
  EXPECT_EQ(
      codeOf(client.registerCodeSigningInfo(kApp, Dictionary{{"id", platform::UUID::random()}})),
      kInvalidArgument);
  EXPECT_EQ(client.codeSigningInfo(kApp).value(), large) << "and nothing has changed";

  // A caller's own entitlements, of every size and kind.
  Caller odd;
  odd.entitlements = {{kGroupsKey, Value::Array{"g", 5}},
                      {kSystemGroupsKey, Dictionary{}},
                      {"com.veltra.security.system-container", "yes"},
                      {"blob", std::string(8 << 20, 'x')}};
  Client caller = device_->connect(odd);
  EXPECT_EQ(codeOf(caller.groupContainers()), kDone);
  odd.identifier = std::string("com.example\0.nul", 16);
  Client nameless = device_->connect(odd);
  EXPECT_NE(codeOf(nameless.createOrLookup(std::nullopt, 2, {.createIfNecessary = true})), kDone);
}

}  // namespace
