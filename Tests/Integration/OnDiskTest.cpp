// What the daemon leaves on the disk, and what it makes of what it finds there.
#include <acl/libacl.h>
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <filesystem>

#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/Subprocess.h"

using tessary::ContainerClass;

namespace {

enum Code : uint64_t { kDone = 1, kNotFound = 21, kInconsistent = 44 };

constexpr uid_t kRoot = 0;
constexpr uid_t kInstallation = 33;
constexpr uid_t kMobile = 501;
constexpr uid_t kAlice = 600;
constexpr uid_t kNobody = 4294967294;
constexpr char kIdentifier[] = "com.example.n\u00e9w";
constexpr char kMetadataName[] = "/.com.veltra.tessary.metadata.plist";
constexpr char kCaches[] = "/private/var/root/Library/Caches/com.veltra.tessaryd";
constexpr char kShared[] = "/private/var/containers/";
constexpr char kHome[] = "/private/var/mobile/Containers/";

// Owner, group, mode and protection class as one text: "501:501 0755 class 0". A directory that is
// not marked is of class 0, a file of class 3.
std::string stateOf(const std::string& path) {
  struct stat status{};
  if (::lstat(path.c_str(), &status) != 0) return "missing";
  std::array<char, 16> mark{S_ISDIR(status.st_mode) ? '0' : '3'};
  (void)::lgetxattr(path.c_str(), "trusted.tessary.protection-class", mark.data(), mark.size() - 1);
  return fmt::format("{}:{} {:04o} class {}", status.st_uid, status.st_gid, status.st_mode & 07777U,
                     mark.data());
}

std::string state(uid_t owner, const char* mode, int protectionClass = 0) {
  return fmt::format("{}:{} {} class {}", owner, owner, mode, protectionClass);
}

// The access-control list, "; " and the one that new items get.
std::string aclsOf(const std::string& path) {
  std::string result;
  for (const acl_type_t type : std::vector<acl_type_t>{ACL_TYPE_ACCESS, ACL_TYPE_DEFAULT}) {
    acl_t acl = ::acl_get_file(path.c_str(), type);
    if (acl == nullptr) return "none";
    char* const text = ::acl_to_any_text(acl, nullptr, ',', TEXT_ABBREVIATE | TEXT_NUMERIC_IDS);
    result += (result.empty() ? "" : "; ") + std::string(text);
    ::acl_free(text);
    ::acl_free(acl);
  }
  return result;
}

std::string directoriesIn(const std::string& path) {
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(path)) {
    if (entry.is_directory()) names.push_back(entry.path().string().substr(path.size() + 1));
  }
  std::ranges::sort(names);
  return fmt::format("{}", fmt::join(names, " "));
}

std::string nameOf(const std::string& path) {
  return path.substr(path.rfind('/') + 1);
}

class OnDisk : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "owners and trusted attributes are needed";
    device_.emplace(/*parent=*/"", /*user=*/"alice:600");
    device_->start();
  }

  std::string path(const std::string& path) const { return device_->path(path); }
  void expectStates(const std::vector<std::pair<std::string, std::string>>& states) const {
    for (const auto& [below, expected] : states) EXPECT_EQ(stateOf(path(below)), expected) << below;
  }
  void expectNothingInStaging() const {
    for (const char* home :
         {"/private/var/mobile/Containers", "/private/var/users/alice/Containers", kCaches}) {
      EXPECT_TRUE(itemsIn(*device_, home + std::string("/Staging")).empty()) << home;
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
  const char* subdirectories;
} kRows[] = {
    {"Bundle/Application", kInstallation, ""},
    {"Data/Application", kMobile,
     "Documents Library Library/Caches Library/Preferences SystemData tmp"},
    {"Bundle/ModulinePlugin", kInstallation, ""},
    {"Data/ModulinePlugin", kMobile, "Library Library/Caches Library/Preferences SystemData tmp"},
    {"Bundle/VPNPlugin", kInstallation, ""},
    {"Data/VPNPlugin", kMobile, kServiceNames},
    {"Shared/AppGroup", kMobile, kGroupNames},
    {"Bundle/Framework", kInstallation, ""},
    {"Data/RelayService", kMobile, kServiceNames},
    {"Data/InternalDaemon", kMobile, kServiceNames},
    {"Data/TempDir", kMobile, kServiceNames},
    {"Data/System", kRoot, kServiceNames},
    {"Shared/SystemGroup", kRoot, kGroupNames},
};

TEST_F(OnDisk, EachClassHasItsPlaceOwnersModesAndListsForGood) {
  Caller alice = privilegedCaller();
  alice.uid = kAlice;
  // What each caller was told of his container of each class.
  std::vector<std::tuple<Caller, ContainerClass, std::string>> made;
  const auto told = [](const Answer& answer) { return answer.text("uuid") + answer.text("path"); };
  for (ContainerClass containerClass = 1; containerClass <= std::size(kRows); ++containerClass) {
    const Row& row = kRows[containerClass - 1];
    const bool isPerUser = row.owner == kMobile;
    const bool isSystem = row.owner == kRoot;
    for (const Caller& caller : {privilegedCaller(), alice}) {
      if (caller.uid == kAlice && !isPerUser) continue;
      const Answer answer = device_->create(caller, kIdentifier, containerClass);
      ASSERT_EQ(answer.code, kDone) << containerClass << ": " << answer.errors;
      made.emplace_back(caller, containerClass, told(answer));
      const std::string container = answer.text("path");
      SCOPED_TRACE(container);
      const uid_t owner = isPerUser ? caller.uid : row.owner;
      const std::string directory =
          path((!isPerUser             ? kShared
                : caller.uid == kAlice ? "/private/var/users/alice/Containers/"
                                       : kHome) +
               std::string(row.directory));
      EXPECT_EQ(container, directory + "/" + nameOf(container));
      EXPECT_TRUE(platform::UUID::parse(nameOf(container)));
      EXPECT_NE(nameOf(container), answer.text("uuid"));
      EXPECT_EQ(stateOf(directory), state(owner, "0755"));
      EXPECT_EQ(stateOf(container), state(owner, isSystem ? "0775" : "0755"));
      EXPECT_EQ(stateOf(container + kMetadataName), state(kRoot, "0644", 4));
      // System containers give their content to the group of the system's users.
      const std::string inherited = "; u::rwx,g::---,g:250:rwx,m::rwx,o::---";
      EXPECT_EQ(aclsOf(container), isSystem ? "u::rwx,g::r-x,g:250:rwx,m::rwx,o::r-x" + inherited
                                            : "u::rwx,g::r-x,o::r-x; ");
      EXPECT_EQ(directoriesIn(container), row.subdirectories);
      for (const auto& item : std::filesystem::recursive_directory_iterator(container)) {
        if (!item.is_directory()) continue;
        EXPECT_EQ(stateOf(item.path()), isSystem ? state(kNobody, "0070") : state(owner, "0755"));
        EXPECT_EQ(aclsOf(item.path()), isSystem
                                           ? "u::---,g::---,g:250:rwx,m::rwx,o::---" + inherited
                                           : "u::rwx,g::r-x,o::r-x; ");
      }
    }
  }
  for (const bool isKilled : {false, true}) {
    if (isKilled) device_->kill();
    EXPECT_EQ(device_->stop(), isKilled ? -1 : 0);
    device_->start();
    for (const auto& [caller, containerClass, before] : made) {
      const Answer found = device_->create(caller, kIdentifier, containerClass);
      EXPECT_EQ(told(found), before) << containerClass;
      EXPECT_EQ(found.json.at("existed"), true);
    }
  }
  expectNothingInStaging();
}

TEST_F(OnDisk, WellKnownContainersHaveTheirNamesForDirectories) {
  const struct {
    const char* identifier;
    ContainerClass containerClass;
    const char* place;  // "" when it lies under a UUID
  } kCases[] = {
      {"com.veltra.exampled", 12, "Data/System/com.veltra.exampled"},
      {"systemgroup.com.veltra.tiles", 13, "Shared/SystemGroup/systemgroup.com.veltra.tiles"},
      {"com.veltra.exampled", 13, ""},
      {"systemgroup.com.veltra.coverage", 13, ""},  // not on this build
      {"com.veltra.exampled", 2, ""},
  };
  for (const bool isMade : {false, true}) {
    for (const auto& [identifier, containerClass, place] : kCases) {
      const Answer answer = isMade
                                ? device_->lookup(privilegedCaller(), identifier, containerClass)
                                : device_->create(privilegedCaller(), identifier, containerClass);
      ASSERT_EQ(answer.code, kDone) << identifier << answer.errors;
      if (*place == '\0') {
        EXPECT_TRUE(platform::UUID::parse(nameOf(answer.text("path")))) << answer.text("path");
      } else {
        EXPECT_EQ(answer.text("path"), path(kShared + std::string(place)));
      }
    }
    device_->stop();
    device_->start();
  }
}

TEST_F(OnDisk, DirectoriesOnTheWayAndTransientContainers) {
  const std::string caches = kCaches;
  const std::pair<const char*, std::string> kTransient[] = {
      {"1", "/private/var/containers/Temp/Bundle/Application/"},
      {"2", "/private/var/mobile/Containers/Temp/Data/Application/"},
      {"12", caches + "/Temp/Data/System/"},
  };
  for (const auto& [containerClass, directory] : kTransient) {
    SCOPED_TRACE(directory);
    const auto ask = [&](const char* command, bool transient) {
      std::vector<std::string> words = {command, "--class", containerClass, "com.example.new"};
      if (transient) words.emplace_back("--transient");
      return device_->ask(privilegedCaller(), words);
    };
    // Each transient one takes the place of the one before, and none is found.
    const Answer first = ask("create", /*transient=*/true);
    EXPECT_TRUE(first.text("path").starts_with(path(directory))) << first.errors;
    EXPECT_EQ(ask("lookup", /*transient=*/true).code, kNotFound);
    const Answer second = ask("create", /*transient=*/true);
    EXPECT_EQ(second.json.at("existed"), false);
    EXPECT_NE(second.text("uuid"), first.text("uuid"));
    EXPECT_EQ(itemsIn(*device_, directory), std::vector{nameOf(second.text("path"))});
    EXPECT_EQ(ask("lookup", /*transient=*/false).code, kNotFound) << "it is not a lasting one";
    EXPECT_EQ(ask("create", /*transient=*/false).code, kDone);
  }
  EXPECT_TRUE(becomes([&] { return itemsIn(*device_, kDeathRow).empty(); }));
  const std::string shared = kShared;
  const std::string home = kHome;
  const std::string logs = "/private/var/root/Library/Logs/Tessary";
  const std::string run = "/run/tessary";
  expectStates({
      {shared + "Bundle", state(kRoot, "0755")},
      {shared + "Bundle/Application", state(kInstallation, "0755")},
      {shared + "Data", state(kRoot, "0755")},
      {shared + "Temp", state(kInstallation, "0755")},
      {shared + "Temp/Bundle/Application", state(kInstallation, "0755")},
      {home, state(kMobile, "0755")},
      {home + "Data", state(kRoot, "0755")},
      {home + "Staging", state(kMobile, "0755")},
      {home + "Temp", state(kMobile, "0755")},
      {home + "Temp/Data/Application", state(kMobile, "0755")},
      {caches, state(kRoot, "0755", 4)},
      {caches + "/Staging", state(kRoot, "0755")},
      {caches + "/Temp/Data/System", state(kRoot, "0755")},
      {logs, state(kRoot, "0755", 4)},
      {logs + "/tessaryd.log", state(kRoot, "0644", 3)},
      {run + "/com.veltra.tessaryd", state(kRoot, "0666", 3)},
      {run + "/tasks", state(kRoot, "0700")},
      {run + "/sandbox/mappings", state(kRoot, "0644", 3)},
  });
  expectNothingInStaging();
}

constexpr char kDescribe[] = R"(
import json, plistlib, sys
data = open(sys.argv[1], 'rb').read()
print(data[:8].decode(), json.dumps(plistlib.loads(data), sort_keys=True))
)";

TEST_F(OnDisk, AnotherReaderReadsTheMetadataFile) {
  const auto run = [&](const std::string& script, const std::string& argument) {
    return runToEnd({"/usr/bin/env", "python3", "-c", script, argument});
  };
  if (run("import plistlib", "").exitStatus != 0) GTEST_SKIP() << "python3 is not installed";
  const std::pair<ContainerClass, const char*> kIdentities[] = {
      {1, ""},
      {2,
       "\"TSYMetadataUserIdentity\": {\"posixGID\": 501, \"posixUID\": 501, \"type\": 0, "
       "\"version\": \"2\"}, "},
      {12, ""},
  };
  for (const auto& [containerClass, identity] : kIdentities) {
    const Answer made = device_->create(privilegedCaller(), kIdentifier, containerClass);
    EXPECT_EQ(run(kDescribe, made.text("path") + kMetadataName).output,
              fmt::format("bplist00 {{\"TSYMetadataContentClass\": {}, \"TSYMetadataIdentifier\": "
                          "\"com.example.n\\u00e9w\", \"TSYMetadataUUID\": \"{}\", {}"
                          "\"TSYMetadataVersion\": \"2\"}}\n",
                          containerClass, made.text("uuid"), identity));
  }
}

TEST_F(OnDisk, WhatIsRemovedBehindItsBackIsNoticed) {
  const Caller installer = privilegedCaller();
  const std::string first = device_->create(installer, "com.example.new", 2).text("path");
  std::filesystem::remove_all(first);
  EXPECT_EQ(device_->lookup(installer, "com.example.new", 2).code, kInconsistent);
  EXPECT_EQ(device_->lookup(installer, "com.example.new", 2).code, kNotFound);
  EXPECT_EQ(device_->create(installer, "com.example.new", 2).json.at("existed"), false);

  // The whole tree goes: every directory on the way comes back, with its owner.
  for (const char* tree : {kHome, kShared, kCaches}) std::filesystem::remove_all(path(tree));
  EXPECT_EQ(device_->ask(installer, {"list", "--class", "2"}).json.size(), 0U);
  for (const ContainerClass containerClass : std::vector<ContainerClass>{1, 2, 12}) {
    EXPECT_EQ(device_->create(installer, "com.example.second", containerClass).code, kDone);
  }
  expectStates({{kHome, state(kMobile, "0755")},
                {kHome + std::string("Data/Application"), state(kMobile, "0755")},
                {kShared + std::string("Bundle/Application"), state(kInstallation, "0755")},
                {kCaches, state(kRoot, "0755", 4)}});
}

TEST_F(OnDisk, TheDaemonEndsWhileIdleClientsAreConnected) {
  tessary::Client asked = device_->connect(privilegedCaller());
  const auto silent = tessary::Client::connect(device_->root());
  ASSERT_TRUE(asked.personaList() && silent);
  EXPECT_EQ(device_->stop(), 0);
  EXPECT_FALSE(asked.personaList());
}

}  // namespace
