// Who may do what: real processes with different identifiers and entitlements ask the real daemon.
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <iterator>
#include <limits>
#include <set>
#include <sstream>

#include "Platform/os/AuditToken.h"
#include "Platform/os/Sandbox.h"
#include "Tests/Integration/Device.h"
#include "Tests/Integration/Subprocess.h"

using platform::Value;
using platform::ipc::Message;
using Array = Value::Array;
using Dictionary = Value::Dictionary;

namespace {

enum Code : uint64_t {
  kDone = 1,
  kNoIdentifier = 18,
  kUnexpectedClass = 20,
  kNotFound = 21,
  kInvalidCommand = 49,
  kRefused = 55,
  kNoUserIdentity = 76,
};

constexpr uint64_t kCommandCount = 33;
constexpr uint64_t kSystemContainerPath = 15;
constexpr uid_t kMobile = 501;
constexpr uint64_t kHuge = std::numeric_limits<uint64_t>::max();

std::vector<std::string> words(const std::string& line) {
  std::istringstream stream(line);
  return {std::istream_iterator<std::string>(stream), {}};
}

Caller named(const std::string& identifier) {
  Caller caller;
  caller.identifier = identifier;
  return caller;
}

class Rights : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "processes of several users are needed";
    device_.emplace();
    device_->start();
  }

  static uint64_t codeOf(tessary::Client& client, uint64_t command, Message request) {
    const auto reply = client.call(command, std::move(request));
    return reply ? uint64_t{kDone} : reply.error().code;
  }

  std::optional<Device> device_;
};

TEST_F(Rights, OfTheCallerOverContainers) {
  const Caller installer = privilegedCaller();
  for (const uint64_t containerClass : std::vector<uint64_t>{2, 7, 12}) {
    ASSERT_EQ(device_->create(installer, "com.example.other", containerClass).code, kDone);
  }
  const Caller plain;
  const Caller allowed = Caller().with("allowed");
  const auto otherIds = [](Value value) { return Caller().with("otherIdLookup", value); };
  const auto lookup = [](Value lists) { return Caller().with("lookup", std::move(lists)); };
  const auto list = [&](const char* key, Value names) {
    return lookup(Dictionary{{key, std::move(names)}});
  };
  const Value otherOnly = Array{"com.example.other"};
  const Value ownOnly = Array{plain.identifier};
  Caller unprefixed;
  unprefixed.entitlements.emplace("allowed", true);
  const Caller widget = named("com.veltra.examplewidget");
  const Caller seeker = named("com.veltra.seekerd");
  const Caller shelf = named("com.veltra.shelfd");
  const Caller hatchery = named("com.veltra.hatcheryd");

  Caller ofService = named("com.example.service");
  ofService.entitlements = {
      {"com.veltra.security.system-container", true},
      {"com.veltra.security.system-groups", "systemgroup.com.example"},
      {"com.veltra.security.application-groups", Array{"group.one", "group.two"}}};

  const std::string create = "create --class ";
  const std::string other2 = "lookup --class 2 com.example.other";
  const std::string other12 = "lookup --class 12 com.example.other";
  const std::string otherPath = "system-path com.example.other";
  const std::string wellknownPath = "system-path com.veltra.exampled";
  const struct {
    const char* who;
    Caller caller;
    std::string question;  // the words of a command line of tessaryctl
    uint64_t code;
  } kCases[] = {
      {"own", plain, create + "2", kDone},
      {"own group", plain, create + "13", kDone},
      {"another's", plain, other2, kRefused},
      {"another's group", plain, "lookup --class 7 com.example.other", kRefused},
      {"another's, to be made", plain, create + "2 com.example.new", kRefused},
      {"by case", plain, create + "2 com.example.App", kRefused},

      {"lookup", list("appData", otherOnly), other2, kDone},
      {"strings among others", list("appData", Array{1, "com.example.other"}), other2, kDone},
      {"another class's list", list("pluginData", otherOnly), other2, kRefused},
      {"no list", list("appData", "com.example.other"), other2, kRefused},
      {"no dictionary", lookup(Array{"appData", "com.example.other"}), other2, kRefused},
      {"otherIdLookup", otherIds(true), other2, kDone},
      {"otherIdLookup", otherIds(true), create + "7 com.example.made", kDone},
      {"number 1", otherIds(1), other2, kDone},
      {"number 0", otherIds(0), other2, kRefused},
      {"string", otherIds("true"), other2, kRefused},
      {"allowed", allowed, other2, kDone},
      {"allowed, a string", Caller().with("allowed", "true"), other2, kRefused},
      {"a short name", unprefixed, other2, kRefused},

      {"own system container", plain, create + "12", kRefused},
      {"another's system container", plain, other12, kRefused},
      {"well-known, by command 0", plain, create + "12 com.veltra.exampled", kRefused},
      {"own in the lookup", list("systemData", ownOnly), create + "12", kDone},
      {"lookup", list("systemData", otherOnly), other12, kDone},
      {"lookup of the group", list("systemGroup", otherOnly), other12, kRefused},
      {"otherIdLookup", otherIds(true), other12, kDone},
      {"allowed", allowed, other12, kDone},
      {"any, by its name", named("com.veltra.vaultd"), other12, kDone},

      {"the widget", widget, create + "2 com.veltra.exampleapp", kDone},
      {"the widget", widget, create + "4 com.veltra.exampleapp", kRefused},
      {"the widget", widget, other2, kRefused},
      {"the seeker", seeker, create + "2 com.veltra.notebook", kDone},
      {"the seeker", seeker, create + "2 com.veltra.exampleapp", kRefused},
      {"the shelf", shelf, create + "7 group.com.veltra.shelf", kDone},
      {"the installer", hatchery, other12, kDone},
      {"anyone", plain, create + "10 com.veltra.beacond", kDone},
      {"anyone", plain, create + "2 com.veltra.beacond", kRefused},

      {"own system container, entitled", ofService, create + "12", kDone},
      {"own path, entitled", ofService, "system-path", kDone},
      {"own path", plain, "system-path", kRefused},
      {"another's path", plain, otherPath, kRefused},
      {"a well-known path", plain, wellknownPath, kDone},
      {"own path in the lookup", list("systemData", ownOnly), "system-path", kDone},
      {"an empty lookup", lookup(Dictionary{}), otherPath, kRefused},
      {"otherIdLookup", otherIds(true), otherPath, kDone},
      {"listing", lookup(Dictionary{}), "list --class 2", kDone},
      {"listing", lookup(Array{}), "list --class 2", kRefused},
      {"listing", otherIds(true), "list --class 2", kRefused},
      {"listing", allowed, "list --class 2", kDone},

      {"own groups", ofService, "groups", kDone},
      {"own groups, none", plain, "groups", kDone},
      {"another's groups", plain, "groups com.example.service", kRefused},
      {"lookup of groups", list("appGroup", Array{"com.example.service"}),
       "groups com.example.service", kDone},
      {"lookup of another class", list("systemGroup", Array{"com.example.service"}),
       "groups com.example.service", kRefused},
      {"own system groups", ofService, "system-groups", kDone},
      {"another's system groups", plain, "system-groups com.example.service", kRefused},
      {"own group identifiers", ofService, "group-ids", kRefused},
      {"group identifiers", allowed, "group-ids com.example.service", kDone},
      {"own system group", ofService, "system-group-path systemgroup.com.example", kDone},
      {"another's system group", plain, "system-group-path systemgroup.com.example", kRefused},
      {"even with all rights", allowed, "system-group-path systemgroup.com.example", kRefused},
      {"a well-known one", plain, "system-group-path systemgroup.com.veltra.tiles", kDone},
      {"an owner without it", ofService,
       "system-group-path systemgroup.com.example --owner com.example.other", kNotFound},
      {"registration", plain, "register com.example.other --forget", kRefused},
      {"registration", allowed, "register com.example.other --forget", kDone},
      {"information", allowed, "code-signing-info com.example.other", kNotFound},
      {"information", plain, "code-signing-info com.example.app", kRefused},
      {"invalidation", plain, "invalidate", kRefused},
      {"invalidation", allowed, "invalidate", kDone},
  };
  for (const auto& one : kCases) {
    const Answer answer = device_->ask(one.caller, words(one.question));
    EXPECT_EQ(answer.code, one.code) << one.who << ": " << one.question << "\n" << answer.errors;
  }
  EXPECT_EQ(device_->ask(plain, words(wellknownPath)).text("path"),
            device_->path("/private/var/containers/Data/System/com.veltra.exampled"));
  EXPECT_EQ(device_->lookup(installer, "com.example.new", 2).code, kNotFound)
      << "what was refused has been made";
}

// Each entitlement opens its own rows of the table and no others.
TEST_F(Rights, OfEachEntitlementOverTheRows) {
  const auto contains = [](const std::vector<uint64_t>& list, uint64_t command) {
    return std::ranges::find(list, command) != list.end();
  };
  const std::vector<uint64_t> forAnybody = {0, 13, 15, 16, 17, 28, 32};
  const std::vector<uint64_t> testability = {25, 31};
  std::vector<uint64_t> ordinary;
  for (uint64_t command = 0; command < kCommandCount; ++command) {
    if (!contains(testability, command)) ordinary.push_back(command);
  }
  const struct {
    const char* what;
    Caller caller;
    std::vector<uint64_t> opened;
  } kGrants[] = {
      {"nothing", Caller(), {}},
      {"lookup", Caller().with("lookup", Dictionary{}), {1, 14, 23}},
      {"otherIdLookup", Caller().with("otherIdLookup"), {}},
      {"userManagedAssets", Caller().with("userManagedAssets"), {4, 28, 29}},
      {"wipeContainer, a list", Caller().with("wipeContainer", Array{"com.veltra.exampled"}), {11}},
      {"wipeContainer, no list", Caller().with("wipeContainer"), {}},
      {"deleteContainerContent", Caller().with("deleteContainerContent"), {12}},
      {"dataMigration", Caller().with("dataMigration"), {24}},
      {"testability", Caller().with("testability"), testability},
      {"stageSharedContent", Caller().with("stageSharedContent"), {26}},
      {"allowed", Caller().with("allowed"), ordinary},
  };
  // Rows without an operation say so to whoever may use them.
  const std::vector<uint64_t> notBuilt = {21, 24, 25, 30, 31};
  for (const auto& grant : kGrants) {
    tessary::Client client = device_->connect(grant.caller);
    for (uint64_t command = 0; command < kCommandCount; ++command) {
      // What anybody may ask of commands 15 and 17: for well-known names. Elsewhere his own count.
      Message request(Dictionary{{"GroupIdentifier", "systemgroup.com.veltra.tiles"}});
      if (command == kSystemContainerPath) request.set("Identifier", "com.veltra.exampled");
      const uint64_t code = codeOf(client, command, std::move(request));
      const bool open = contains(forAnybody, command) || contains(grant.opened, command);
      EXPECT_EQ(code != kRefused, open) << grant.what << ", command " << command;
      if (open && contains(notBuilt, command)) {
        EXPECT_EQ(code, kInvalidCommand) << grant.what << ", command " << command;
      }
    }
  }
}

// Keys of the wrong type read as missing ones, and numbers out of range reach no handler.
TEST_F(Rights, StrangeRequestsAreAnswered) {
  tessary::Client client = device_->connect(Caller().with("allowed"));
  for (const uint64_t command : {kCommandCount, kHuge, (uint64_t{1} << 32U) + 1}) {
    EXPECT_EQ(codeOf(client, command, Message()), kInvalidCommand) << command;
  }
  const auto create = [](Value identifier, Value containerClass) {
    return Message({{"Identifier", std::move(identifier)},
                    {"ContainerClass", std::move(containerClass)},
                    {"CreateIfNecessary", true}});
  };
  const std::string name = "com.example.new";
  for (const Value& wrong : Array{0, 14, kHuge, -1, "2", true, Value()}) {
    EXPECT_EQ(codeOf(client, 0, create(name, wrong)), kUnexpectedClass) << wrong.description();
  }
  for (const Value& wrong : {Value(5), Value(), Value(Array{name}), Value(Value::Data{'a'})}) {
    const auto reply = client.call(0, create(wrong, 2));
    ASSERT_TRUE(reply) << wrong.description();
    EXPECT_EQ(*reply->string("ReplyIdentifier"), "com.example.app") << wrong.description();
  }
  const Message onlyWanted({{"Identifier", name}, {"ContainerClass", 2}, {"CreateIfNecessary", 1}});
  EXPECT_EQ(codeOf(client, 0, onlyWanted), kNotFound) << "1 is not true";
}

// --- Who the caller is --------------------------------------------------------------------------

TEST_F(Rights, AProcessWithoutARecordIsNobody) {
  const std::string nobody = "/usr/bin/env setpriv --reuid=501 --regid=501 --clear-groups " +
                             Device::program("tessaryctl") + " --root " + device_->root() + " ";
  const std::pair<const char*, uint64_t> cases[] = {
      {"create --class 2", kNoIdentifier},
      {"create --class 2 com.example.app", kNoUserIdentity},
      {"create --class 10 com.veltra.beacond", kNoUserIdentity},
      {"list --class 2", kRefused},
      {"system-path", kNoIdentifier},
      {"system-path com.veltra.exampled", kNoUserIdentity},
  };
  for (const auto& [question, code] : cases) {
    const Finished finished = runToEnd(words(nobody + question));
    EXPECT_NE(finished.errors.find(fmt::format("({})", code)), std::string::npos)
        << question << ": " << finished.errors;
  }
  const Finished personas = runToEnd(words(nobody + "personas"));
  EXPECT_EQ(personas.exitStatus, 0) << personas.errors;
  EXPECT_EQ(personas.output, "");
}

// A record that anybody else may have written, or that is another process's, gives nothing.
TEST_F(Rights, OnlyTheLaunchersRecordIsBelieved) {
  const std::string directory = device_->path("/run/tessary/tasks");
  const uint64_t startTime = *platform::processStartTime(::getpid());
  const auto recordOf = [&](pid_t pid, uint64_t time) {
    return fmt::format("{}/{}.{}.plist", directory, pid, time);
  };
  const std::string record = recordOf(::getpid(), startTime);
  const std::string aside = device_->path("/aside.plist");
  const struct {
    const char* what;
    std::function<void()> spoil;
    uint64_t code = kNoIdentifier;
  } kCases[] = {
      {"as it was written", [] {}, kDone},
      {"a user's", [&] { (void)::chown(record.c_str(), kMobile, kMobile); }},
      {"writable by a group", [&] { ::chmod(record.c_str(), 0660); }},
      {"writable by all", [&] { ::chmod(record.c_str(), 0602); }},
      {"in a directory open to a group", [&] { ::chmod(directory.c_str(), 0770); }},
      {"in a user's directory", [&] { (void)::chown(directory.c_str(), kMobile, kMobile); }},
      {"a link to a good one",
       [&] {
         std::filesystem::rename(record, aside);
         std::filesystem::create_symlink(aside, record);
       }},
      {"a FIFO",
       [&] {
         std::filesystem::remove(record);
         ::mkfifo(record.c_str(), 0600);
       }},
      {"of an earlier process with the pid",
       [&] { std::filesystem::rename(record, recordOf(::getpid(), startTime - 1)); }},
      {"of another process",
       [&] { std::filesystem::rename(record, recordOf(::getppid(), startTime)); }},
  };
  for (const auto& [what, spoil, code] : kCases) {
    std::filesystem::remove_all(directory);
    (void)device_->connect(privilegedCaller());
    spoil();
    auto client = tessary::Client::connect(device_->root());
    ASSERT_TRUE(client) << what;
    EXPECT_EQ(codeOf(*client, 0, Message({{"ContainerClass", 2}, {"CreateIfNecessary", true}})),
              code)
        << what;
    EXPECT_EQ(codeOf(*client, 27, Message()), code == kDone ? kInvalidCommand : kRefused) << what;
  }
}

// The daemon remembers the installer's identity: of the one process, not of the name.
TEST_F(Rights, OneInstallerDoesNotLendItsRightsToAnother) {
  const Caller weak = named("com.veltra.hatcheryd");
  tessary::Client remembered = device_->connect(weak.with("allowed"));
  for (int i = 0; i < 2; ++i) {
    EXPECT_EQ(codeOf(remembered, 27, Message()), kInvalidCommand);
    EXPECT_EQ(device_->ask(weak, {"retired"}).code, kRefused);
    EXPECT_EQ(device_->ask(weak.with("allowed"), {"retired"}).code, kInvalidCommand);
  }
}

TEST_F(Rights, TokensOpenEnterpriseContainersToSandboxedProcesses) {
  device_->stop();
  device_->setPersonas({{"P", 100, "personal", "", {}},
                        {"W", 101, "enterprise", "/private/var/office", {"com.example.mixed"}}});
  device_->start();
  const auto process =
      platform::AuditToken::make(0, 0, ::getpid(), *platform::processStartTime(::getpid()));
  for (const bool sandboxed : {false, true}) {
    Caller caller = named("com.example.mixed").with("allowed");  // whose persona it is given
    caller.sandboxed = sandboxed;
    tessary::Client client = device_->connect(caller);
    for (tessary::ContainerClass containerClass = 1; containerClass <= 13; ++containerClass) {
      SCOPED_TRACE(containerClass);
      const auto found =
          client.createOrLookup(std::nullopt, containerClass, {.createIfNecessary = true});
      ASSERT_TRUE(found) << found.error().code;
      const bool isOpened = std::set<uint64_t>{2, 4, 6, 7, 10}.contains(containerClass);
      ASSERT_EQ(found->sandboxToken.has_value(), sandboxed && isOpened);
      if (!found->sandboxToken) continue;
      const std::string kind = containerClass == 7 ? "application-group" : "container";
      EXPECT_TRUE(found->sandboxToken->starts_with(
          fmt::format("com.veltra.sandbox.{};{};{};", kind, ::getpid(), found->path)));
      EXPECT_TRUE(
          platform::Sandbox(device_->files()).verifyExtension(*found->sandboxToken, process));
    }
  }
}

}  // namespace
