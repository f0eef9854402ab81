// What the daemon leaves on the disk, and what it makes of what it finds there.
#include <acl/libacl.h>
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <thread>

#include "Tests/Integration/Device.h"
#include "Tests/Integration/Subprocess.h"

using std::filesystem::exists;
using tessary::ContainerClass;

namespace {

enum Code : uint64_t { kDone = 1, kNotFound = 21, kInconsistent = 44 };

constexpr uid_t kRoot = 0;
constexpr uid_t kInstallation = 33;
constexpr uid_t kMobile = 501;
constexpr uid_t kAlice = 600;
constexpr uid_t kNobody = 4294967294;
constexpr char kMetadataName[] = "/.com.veltra.tessary.metadata.plist";
constexpr char kCaches[] = "/private/var/root/Library/Caches/com.veltra.tessaryd";

// Owner, group, mode and protection class as one text: "501:501 0755 class 0". A directory that is
// not marked is of class 0, a file of class 3.
std::string stateOf(const std::string& path) {
  struct stat status{};
  if (::lstat(path.c_str(), &status) != 0) return "missing";
  char value[16];
  const ssize_t length =
      ::lgetxattr(path.c_str(), "trusted.tessary.protection-class", value, sizeof value);
  const std::string protectionClass = length > 0 ? std::string(value, static_cast<size_t>(length))
                                      : S_ISDIR(status.st_mode) ? "0"
                                                                : "3";
  return fmt::format("{}:{} {:04o} class {}", status.st_uid, status.st_gid, status.st_mode & 07777U,
                     protectionClass);
}

std::string state(uid_t owner, const char* mode, int protectionClass = 0) {
  return fmt::format("{}:{} {} class {}", owner, owner, mode, protectionClass);
}

std::string aclOf(const std::string& path, acl_type_t type) {
  const acl_t acl = ::acl_get_file(path.c_str(), type);
  if (acl == nullptr) return "none";
  char* const text = ::acl_to_any_text(acl, nullptr, ',', TEXT_ABBREVIATE | TEXT_NUMERIC_IDS);
  std::string result = text;
  ::acl_free(text);
  ::acl_free(acl);
  return result;
}

std::vector<std::string> directoriesIn(const std::string& path) {
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(path)) {
    if (entry.is_directory()) names.push_back(entry.path().string().substr(path.size() + 1));
  }
  std::sort(names.begin(), names.end());
  return names;
}

std::string nameOf(const std::string& path) {
  return path.substr(path.rfind('/') + 1);
}

Finished python(const std::string& script, const std::vector<std::string>& arguments) {
  std::vector<std::string> command = {"/usr/bin/env", "python3", "-c", script};
  command.insert(command.end(), arguments.begin(), arguments.end());
  return runToEnd(command);
}

class OnDisk : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "owners and trusted attributes are needed";
    device_.emplace();
    ASSERT_EQ(runToEnd({Device::program("tessary-platform"), "--root", device_->root(), "init",
                        "--user", "alice:600"})
                  .exitStatus,
              0);
  }

  std::string path(const std::string& path) const { return device_->path(path); }
  // Waits until `condition` holds; false when it never does.
  static bool becomes(const std::function<bool()>& condition) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (!condition()) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
  }
  void expectStates(const std::vector<std::pair<std::string, std::string>>& states) const {
    for (const auto& [below, expected] : states) EXPECT_EQ(stateOf(path(below)), expected) << below;
  }
  void expectNothingInStaging() const {
    for (const std::string& staging :
         {std::string(kCaches) + "/Staging", std::string("/private/var/mobile/Containers/Staging"),
          std::string("/private/var/users/alice/Containers/Staging")}) {
      if (!exists(path(staging))) continue;
      EXPECT_TRUE(std::filesystem::is_empty(path(staging))) << staging;
    }
  }

  std::optional<Device> device_;
};

constexpr char kServiceNames[] = "Library Library/Caches Library/Preferences tmp";
constexpr char kGroupNames[] = "Library Library/Caches Library/Preferences";

// Mobile stands for the user whose container it is.
constexpr struct Row {
  const char* directory;  // of the class
  uid_t owner;
  uid_t contentOwner;
  const char* subdirectories;
} kRows[] = {
    {"Bundle/Application", kInstallation, kInstallation, ""},
    {"Data/Application", kMobile, kMobile,
     "Documents Library Library/Caches Library/Preferences SystemData tmp"},
    {"Bundle/ModulinePlugin", kInstallation, kInstallation, ""},
    {"Data/ModulinePlugin", kMobile, kMobile,
     "Library Library/Caches Library/Preferences SystemData tmp"},
    {"Bundle/VPNPlugin", kInstallation, kInstallation, ""},
    {"Data/VPNPlugin", kMobile, kMobile, kServiceNames},
    {"Shared/AppGroup", kMobile, kMobile, kGroupNames},
    {"Bundle/Framework", kInstallation, kInstallation, ""},
    {"Data/RelayService", kMobile, kMobile, kServiceNames},
    {"Data/InternalDaemon", kMobile, kMobile, kServiceNames},
    {"Data/TempDir", kMobile, kMobile, kServiceNames},
    {"Data/System", kRoot, kNobody, kServiceNames},
    {"Shared/SystemGroup", kRoot, kNobody, kGroupNames},
};

TEST_F(OnDisk, EachClassHasItsPlaceOwnerModeAndSubdirectories) {
  device_->start();
  Caller alice = privilegedCaller();
  alice.uid = kAlice;
  for (ContainerClass containerClass = 1; containerClass <= std::size(kRows); ++containerClass) {
    const Row& row = kRows[containerClass - 1];
    const bool isPerUser = row.owner == kMobile;
    const bool isSystem = containerClass >= 12;
    for (const Caller& caller : {privilegedCaller(), alice}) {
      if (caller.uid == kAlice && !isPerUser) continue;
      const auto user = [&](uid_t owner) { return isPerUser ? caller.uid : owner; };
      const Answer made = device_->create(caller, "com.example.new", containerClass);
      ASSERT_EQ(made.code, kDone) << containerClass << ": " << made.errors;
      const std::string container = made.text("path");
      SCOPED_TRACE(container);
      const std::string home =
          caller.uid == kAlice ? "/private/var/users/alice" : "/private/var/mobile";
      const std::string directory =
          path((isPerUser ? home + "/Containers/" : "/private/var/containers/") + row.directory);
      EXPECT_EQ(container, directory + "/" + nameOf(container));
      EXPECT_TRUE(platform::UUID::parse(nameOf(container)));
      EXPECT_NE(nameOf(container), made.text("uuid"));
      EXPECT_EQ(stateOf(directory), state(user(row.owner), "0755"));
      EXPECT_EQ(stateOf(container), state(user(row.owner), isSystem ? "0775" : "0755"));
      EXPECT_EQ(stateOf(container + kMetadataName), state(kRoot, "0644", 4));
      const auto subdirectories = directoriesIn(container);
      EXPECT_EQ(fmt::format("{}", fmt::join(subdirectories, " ")), row.subdirectories);
      for (const std::string& name : subdirectories) {
        EXPECT_EQ(stateOf(container + "/" + name),
                  state(user(row.contentOwner), isSystem ? "0070" : "0755"))
            << name;
      }
    }
  }
  expectNothingInStaging();
}

TEST_F(OnDisk, SystemContainersGiveTheirContentToTheSystemUsersGroup) {
  device_->start();
  for (const ContainerClass containerClass : std::vector<ContainerClass>{12, 13}) {
    const Answer made = device_->create(privilegedCaller(), "com.example.new", containerClass);
    const std::string container = made.text("path");
    const std::string byDefault = "u::rwx,g::---,g:250:rwx,m::rwx,o::---";
    EXPECT_EQ(aclOf(container, ACL_TYPE_ACCESS), "u::rwx,g::r-x,g:250:rwx,m::rwx,o::r-x");
    EXPECT_EQ(aclOf(container, ACL_TYPE_DEFAULT), byDefault);
    for (const char* name : {"/Library", "/Library/Preferences"}) {
      EXPECT_EQ(aclOf(container + name, ACL_TYPE_ACCESS), "u::---,g::---,g:250:rwx,m::rwx,o::---");
      EXPECT_EQ(aclOf(container + name, ACL_TYPE_DEFAULT), byDefault);
    }
  }
  const std::string ordinary =
      device_->create(privilegedCaller(), "com.example.new", 2).text("path");
  EXPECT_EQ(aclOf(ordinary, ACL_TYPE_ACCESS), "u::rwx,g::r-x,o::r-x");
  EXPECT_EQ(aclOf(ordinary, ACL_TYPE_DEFAULT), "");
}

TEST_F(OnDisk, WellKnownContainersHaveTheirNamesForDirectories) {
  device_->start();
  const Caller installer = privilegedCaller();
  const struct {
    const char* identifier;
    ContainerClass containerClass;
    const char* place;  // "" when it lies under a UUID
  } kCases[] = {
      {"com.veltra.exampled", 12, "/private/var/containers/Data/System/com.veltra.exampled"},
      {"systemgroup.com.veltra.tiles", 13,
       "/private/var/containers/Shared/SystemGroup/systemgroup.com.veltra.tiles"},
      {"com.veltra.exampled", 13, ""},
      {"systemgroup.com.veltra.tiles", 12, ""},
      {"systemgroup.com.veltra.coverage", 13, ""},  // not on this build
      {"com.veltra.exampled", 2, ""},
  };
  for (const auto& [identifier, containerClass, place] : kCases) {
    const Answer made = device_->create(installer, identifier, containerClass);
    ASSERT_EQ(made.code, kDone) << made.errors;
    if (*place == '\0') {
      EXPECT_TRUE(platform::UUID::parse(nameOf(made.text("path")))) << made.text("path");
    } else {
      EXPECT_EQ(made.text("path"), path(place));
    }
  }
  ASSERT_EQ(device_->stop(), 0);
  device_->start();
  for (const auto& [identifier, containerClass, place] : kCases) {
    const Answer found = device_->lookup(installer, identifier, containerClass);
    EXPECT_EQ(found.code, kDone) << identifier << containerClass << found.errors;
    EXPECT_TRUE(*place == '\0' || found.text("path") == path(place)) << found.text("path");
  }
}

TEST_F(OnDisk, DirectoriesOnTheWayHaveTheirOwnersAndModes) {
  device_->start();
  const Caller installer = privilegedCaller();
  for (const char* containerClass : {"1", "2", "12"}) {
    for (const bool transient : {false, true}) {
      std::vector<std::string> arguments = {"create", "--class", containerClass, "com.example.new"};
      if (transient) arguments.emplace_back("--transient");
      ASSERT_EQ(device_->ask(installer, arguments).code, kDone);
    }
  }
  const std::string shared = "/private/var/containers";
  const std::string user = "/private/var/mobile/Containers";
  const std::string caches = kCaches;
  const std::string logs = "/private/var/root/Library/Logs/Tessary";
  const std::string run = "/run/tessary";
  expectStates({
      {shared, state(kRoot, "0755")},
      {shared + "/Bundle", state(kRoot, "0755")},
      {shared + "/Bundle/Application", state(kInstallation, "0755")},
      {shared + "/Data", state(kRoot, "0755")},
      {shared + "/Data/System", state(kRoot, "0755")},
      {shared + "/Temp", state(kInstallation, "0755")},
      {shared + "/Temp/Bundle/Application", state(kInstallation, "0755")},
      {user, state(kMobile, "0755")},
      {user + "/Data", state(kRoot, "0755")},
      {user + "/Data/Application", state(kMobile, "0755")},
      {user + "/Staging", state(kMobile, "0755")},
      {user + "/Temp", state(kMobile, "0755")},
      {user + "/Temp/Data/Application", state(kMobile, "0755")},
      {caches, state(kRoot, "0755", 4)},
      {caches + "/Staging", state(kRoot, "0755")},
      {caches + "/Dead", state(kRoot, "0755")},
      {caches + "/Temp", state(kRoot, "0755")},
      {caches + "/Temp/Data/System", state(kRoot, "0755")},
      {logs, state(kRoot, "0755", 4)},
      {logs + "/tessaryd.log", state(kRoot, "0644", 3)},
      {run, state(kRoot, "0755")},
      {run + "/com.veltra.tessaryd", state(kRoot, "0666", 3)},
      {run + "/tasks", state(kRoot, "0700")},
      {run + "/sandbox/mappings", state(kRoot, "0644", 3)},
  });
  expectNothingInStaging();
}

// --- The metadata file --------------------------------------------------------------------------

constexpr char kDescribe[] = R"(
import json, plistlib, sys
data = open(sys.argv[1], 'rb').read()
content = plistlib.loads(data)
print(data[:8].decode(), json.dumps(content, sort_keys=True))
)";

TEST_F(OnDisk, AnotherReaderReadsTheMetadataFile) {
  if (python("import plistlib", {}).exitStatus != 0) GTEST_SKIP() << "python3 is not installed";
  device_->start();
  const std::string identifier = "com.example.n\u00e9w";
  const auto described = [&](ContainerClass containerClass, const char* identity) {
    const Answer made = device_->create(privilegedCaller(), identifier, containerClass);
    const Finished told = python(kDescribe, {made.text("path") + kMetadataName});
    EXPECT_EQ(told.output,
              fmt::format("bplist00 {{\"TSYMetadataContentClass\": {}, \"TSYMetadataIdentifier\": "
                          "\"com.example.n\\u00e9w\", \"TSYMetadataUUID\": \"{}\", {}"
                          "\"TSYMetadataVersion\": \"2\"}}\n",
                          containerClass, made.text("uuid"), identity))
        << told.errors;
  };
  described(2,
            "\"TSYMetadataUserIdentity\": {\"posixGID\": 501, \"posixUID\": 501, \"type\": 0, "
            "\"version\": \"2\"}, ");
  described(1, "");
  described(12, "");
}

// Arguments: the class directory, then of each file: format, directory name, JSON of the content.
constexpr char kWrite[] = R"(
import json, os, plistlib, sys
for i in range(2, len(sys.argv), 3):
    form, name, content = sys.argv[i:i + 3]
    directory = os.path.join(sys.argv[1], name)
    os.makedirs(directory)
    with open(os.path.join(directory, '.com.veltra.tessary.metadata.plist'), 'wb') as out:
        plistlib.dump(json.loads(content), out, fmt=getattr(plistlib, form))
)";

TEST_F(OnDisk, ContainersOfAnotherWriterAreFound) {
  if (python("import plistlib", {}).exitStatus != 0) GTEST_SKIP() << "python3 is not installed";
  const std::string mobile =
      R"("TSYMetadataUserIdentity": {"version": "2", "posixUID": 501, "posixGID": 501, "type": 0})";
  const std::string alice =
      R"("TSYMetadataUserIdentity": {"version": "2", "posixUID": 600, "posixGID": 600, "type": 0})";
  const std::string version1 =
      R"("TSYMetadataUserIdentity": {"version": "1", "posixUID": 501, "posixGID": 501})";
  const struct {
    const char* identifier;
    const char* format;
    const char* name;  // "" for a UUID
    std::string rest;  // of the content
    bool found;
  } kCases[] = {
      {"com.example.xml", "FMT_XML", "", mobile, true},
      {"com.example.binary", "FMT_BINARY", "", mobile, true},
      {"com.example.n\u00e9w \U0001F980 <&>", "FMT_XML", "", mobile, true},
      {"com.example.b\u00efnary \U0001F980", "FMT_BINARY", "", mobile, true},
      {"com.example.version1", "FMT_XML", "", version1, true},
      {"com.example.legacy", "FMT_BINARY", "", R"("TSYMetadataPersona": 501)", true},
      {"com.example.info", "FMT_XML", "",
       mobile + R"(, "TSYMetadataInfo": {"a": [1, 2.5, true, {"b": "c"}], "large": 4294967296})",
       true},
      {"com.example.extra", "FMT_BINARY", "", mobile + R"(, "Unknown": [[[]]])", true},
      {"com.example.alices", "FMT_BINARY", "", alice, false},
      {"com.example.legacyalices", "FMT_BINARY", "", R"("TSYMetadataPersona": 600)", false},
      {"com.example.badinfo", "FMT_XML", "", mobile + R"(, "TSYMetadataInfo": [])", false},
      {"com.example.named", "FMT_BINARY", "com.example.named", mobile, false},
      {"com.example.hidden", "FMT_BINARY", ".9E107D9D-3723-4B4E-8F3C-000000000001", mobile, false},
  };
  std::vector<std::string> arguments = {path("/private/var/mobile/Containers/Data/Application")};
  std::vector<std::string> uuids;
  for (const auto& [identifier, format, name, rest, found] : kCases) {
    uuids.push_back(platform::UUID::random().string());
    arguments.emplace_back(format);
    arguments.push_back(*name == '\0' ? platform::UUID::random().string() : name);
    arguments.push_back(
        fmt::format("{{\"TSYMetadataIdentifier\": \"{}\", \"TSYMetadataContentClass\": 2, "
                    "\"TSYMetadataUUID\": \"{}\", {}}}",
                    identifier, uuids.back(), rest));
  }
  const Finished written = python(kWrite, arguments);
  ASSERT_EQ(written.exitStatus, 0) << written.errors;

  device_->start();
  size_t count = 0;
  for (size_t i = 0; i < std::size(kCases); ++i) {
    const auto& one = kCases[i];
    const Answer answer = device_->lookup(privilegedCaller(), one.identifier, 2);
    EXPECT_EQ(answer.code, one.found ? kDone : kNotFound) << one.identifier << answer.errors;
    if (!one.found) continue;
    ++count;
    EXPECT_EQ(answer.text("uuid"), uuids[i]) << one.identifier;
    EXPECT_EQ(answer.text("path"), arguments[0] + "/" + arguments[3 * i + 2]) << one.identifier;
  }
  EXPECT_EQ(device_->ask(privilegedCaller(), {"list", "--class", "2"}).json.size(), count);
}

// --- Time passes --------------------------------------------------------------------------------

TEST_F(OnDisk, ContainersStayWhatTheyAreWhenTheDaemonStartsAgain) {
  device_->start();
  const Caller installer = privilegedCaller();
  std::vector<std::string> before;
  const auto textOf = [](const Answer& answer) {
    return answer.text("uuid") + " " + answer.text("path");
  };
  for (ContainerClass containerClass = 1; containerClass <= 13; ++containerClass) {
    before.push_back(textOf(device_->create(installer, "com.example.new", containerClass)));
  }
  const auto expectAll = [&] {
    for (ContainerClass containerClass = 1; containerClass <= 13; ++containerClass) {
      const Answer found = device_->create(installer, "com.example.new", containerClass);
      EXPECT_EQ(textOf(found), before[containerClass - 1]);
      EXPECT_EQ(found.json.at("existed"), true);
    }
  };
  expectAll();
  EXPECT_EQ(device_->stop(), 0);
  device_->start();
  expectAll();
  device_->kill();
  device_->start();
  expectAll();
  expectNothingInStaging();
}

TEST_F(OnDisk, ATransientContainerIsReplacedByTheNextOne) {
  device_->start();
  const Caller installer = privilegedCaller();
  const struct {
    const char* containerClass;
    std::string directory;
  } kCases[] = {
      {"1", "/private/var/containers/Temp/Bundle/Application/"},
      {"2", "/private/var/mobile/Containers/Temp/Data/Application/"},
      {"12", std::string(kCaches) + "/Temp/Data/System/"},
  };
  for (const auto& [containerClass, directory] : kCases) {
    SCOPED_TRACE(containerClass);
    const auto ask = [&](const char* command) {
      return device_->ask(installer,
                          {command, "--class", containerClass, "--transient", "com.example.new"});
    };
    const Answer first = ask("create");
    ASSERT_EQ(first.code, kDone) << first.errors;
    EXPECT_TRUE(first.text("path").starts_with(path(directory))) << first.text("path");
    EXPECT_EQ(ask("lookup").code, kNotFound);
    EXPECT_TRUE(exists(first.text("path")));
    const Answer second = ask("create");
    EXPECT_EQ(second.json.at("existed"), false);
    EXPECT_NE(second.text("uuid"), first.text("uuid"));
    EXPECT_NE(second.text("path"), first.text("path"));
    EXPECT_FALSE(exists(first.text("path")));
    EXPECT_TRUE(exists(second.text("path") + kMetadataName));
    EXPECT_EQ(
        device_->ask(installer, {"list", "--class", containerClass, "--transient"}).json.size(),
        1U);
    EXPECT_EQ(device_->lookup(installer, "com.example.new", std::stoul(containerClass)).code,
              kNotFound)
        << "it is not a lasting one";
  }
  EXPECT_TRUE(becomes([&] { return std::filesystem::is_empty(path(kCaches) + "/Dead"); }));
}

TEST_F(OnDisk, WhatIsRemovedBehindItsBackIsNoticed) {
  device_->start();
  const Caller installer = privilegedCaller();
  const std::string first = device_->create(installer, "com.example.new", 2).text("path");
  ASSERT_EQ(device_->create(installer, "com.example.second", 2).code, kDone);
  std::filesystem::remove_all(first);
  EXPECT_EQ(device_->lookup(installer, "com.example.new", 2).code, kInconsistent);
  EXPECT_EQ(device_->lookup(installer, "com.example.new", 2).code, kNotFound);
  const Answer again = device_->create(installer, "com.example.new", 2);
  EXPECT_EQ(again.json.at("existed"), false);
  EXPECT_NE(again.text("path"), first);

  // The whole tree goes: every directory on the way comes back, with its owner.
  std::filesystem::remove_all(path("/private/var/mobile/Containers"));
  EXPECT_EQ(device_->ask(installer, {"list", "--class", "2"}).json.size(), 0U);
  EXPECT_EQ(device_->create(installer, "com.example.second", 2).code, kDone);
  expectStates({{"/private/var/mobile/Containers", state(kMobile, "0755")},
                {"/private/var/mobile/Containers/Staging", state(kMobile, "0755")},
                {"/private/var/mobile/Containers/Data/Application", state(kMobile, "0755")}});
  std::filesystem::remove_all(path("/private/var/containers"));
  std::filesystem::remove_all(path(kCaches));
  EXPECT_EQ(device_->create(installer, "com.example.new", 1).code, kDone);
  EXPECT_EQ(device_->create(installer, "com.example.new", 12).code, kDone);
  expectStates({{kCaches, state(kRoot, "0755", 4)},
                {"/private/var/containers/Bundle/Application", state(kInstallation, "0755")}});
}

TEST_F(OnDisk, TheDaemonEndsWhileIdleClientsAreConnected) {
  device_->start();
  std::vector<tessary::Client> clients;
  for (int i = 0; i < 5; ++i) {
    clients.push_back(device_->connect(privilegedCaller()));
    EXPECT_TRUE(i % 2 == 0 || clients.back().personaList());
  }
  const auto started = std::chrono::steady_clock::now();
  EXPECT_EQ(device_->stop(), 0);
  EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(30));
  EXPECT_FALSE(clients.back().personaList());
}

TEST_F(OnDisk, TheRootMayLieDeep) {
  const std::string deep = path("/tmp/" + std::string(120, 'a') + "/" + std::string(120, 'b'));
  std::filesystem::create_directories(deep);
  std::filesystem::permissions(deep, std::filesystem::perms(0755));
  Device device(deep);
  device.start();
  const Answer made = device.create(Caller(), "", 2);
  ASSERT_EQ(made.code, kDone) << made.errors;
  EXPECT_TRUE(made.text("path").starts_with(device.root() + "/private/var/mobile/Containers/"));
  ASSERT_EQ(device.stop(), 0);
  device.start();
  EXPECT_EQ(device.lookup(Caller(), "", 2).text("path"), made.text("path"));
}

}  // namespace
