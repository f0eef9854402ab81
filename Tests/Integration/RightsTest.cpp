// Who may do what: real processes with different identifiers and entitlements ask the real daemon.
#include <fcntl.h>
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <limits>
#include <vector>

#include "Platform/ipc/Codec.h"
#include "Platform/ipc/SocketPath.h"
#include "Platform/os/AuditToken.h"
#include "Platform/os/Sandbox.h"
#include "Tests/Integration/Device.h"
#include "Tests/Integration/Subprocess.h"

using platform::Value;
using platform::ipc::Message;
using Arguments = std::vector<std::string>;
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
constexpr uid_t kMobile = 501;
constexpr uint64_t kHuge = std::numeric_limits<uint64_t>::max();

class Rights : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "processes of several users are needed";
    device_.emplace();
  }

  struct Case {
    const char* who;
    Caller caller;
    Arguments arguments;
    uint64_t code;
  };
  void check(const std::vector<Case>& cases) const {
    for (const Case& one : cases) {
      const Answer answer = device_->ask(one.caller, one.arguments);
      EXPECT_EQ(answer.code, one.code)
          << one.who << ": " << fmt::format("{}", fmt::join(one.arguments, " ")) << "\n"
          << answer.errors;
    }
  }

  // A connection that the daemon is known to have accepted: what is done to the record afterwards
  // does not matter to it.
  tessary::Client accepted(const Caller& caller) const {
    tessary::Client client = device_->connect(caller);
    EXPECT_TRUE(client.personaList());
    return client;
  }

  static uint64_t codeOf(tessary::Client& client, uint64_t command, Message request) {
    const auto reply = client.call(command, std::move(request));
    return reply ? uint64_t{kDone} : reply.error().code;
  }

  std::optional<Device> device_;
};

Caller named(const std::string& identifier) {
  Caller caller;
  caller.identifier = identifier;
  return caller;
}

Caller lookingUp(Value lists) {
  return Caller().with("lookup", std::move(lists));
}

TEST_F(Rights, OfTheCallerOverContainers) {
  device_->start();
  const Caller installer = privilegedCaller();
  for (const uint64_t containerClass : std::vector<uint64_t>{1, 2, 4, 7, 12, 13}) {
    ASSERT_EQ(device_->create(installer, "com.example.other", containerClass).code, kDone);
  }
  ASSERT_EQ(device_->create(installer, "com.veltra.exampleapp", 2).code, kDone);
  ASSERT_EQ(device_->create(installer, "com.veltra.exampleapp", 4).code, kDone);
  ASSERT_EQ(device_->create(installer, "com.veltra.exampled", 12).code, kDone);

  const Caller plain;
  const auto other = [](const char* containerClass) {
    return Arguments{"lookup", "--class", containerClass, "com.example.other"};
  };
  const auto create = [](const char* containerClass, const char* identifier) {
    return Arguments{"create", "--class", containerClass, identifier};
  };
  const Value otherOnly = Array{"com.example.other"};
  Caller unprefixed;
  unprefixed.entitlements.emplace("allowed", true);
  check({
      {"own", plain, {"create", "--class", "2"}, kDone},
      {"own, by name", plain, create("2", "com.example.app"), kDone},
      {"own bundle", plain, {"create", "--class", "1"}, kDone},
      {"own group", plain, {"create", "--class", "13"}, kDone},
      {"another's", plain, other("2"), kRefused},
      {"another's bundle", plain, other("1"), kRefused},
      {"another's group", plain, other("7"), kRefused},
      {"another's, to be made", plain, create("2", "com.example.new"), kRefused},
      {"by case", plain, create("2", "com.example.App"), kRefused},

      {"lookup", lookingUp(Dictionary{{"appData", otherOnly}}), other("2"), kDone},
      {"another class's list", lookingUp(Dictionary{{"pluginData", otherOnly}}), other("2"),
       kRefused},
      {"a class's list", lookingUp(Dictionary{{"appData", otherOnly}}), other("4"), kRefused},
      {"a class's number", lookingUp(Dictionary{{"2", otherOnly}}), other("2"), kRefused},
      {"no list", lookingUp(Dictionary{{"appData", "com.example.other"}}), other("2"), kRefused},
      {"a dictionary as list",
       lookingUp(Dictionary{{"appData", Dictionary{{"com.example.other", true}}}}), other("2"),
       kRefused},
      {"what is no string", lookingUp(Dictionary{{"appData", Array{1, true, otherOnly}}}),
       other("2"), kRefused},
      {"strings among others",
       lookingUp(Dictionary{{"appData", Array{1, Array{}, "com.example.other"}}}), other("2"),
       kDone},
      {"no dictionary", lookingUp(Array{"appData", "com.example.other"}), other("2"), kRefused},

      {"otherIdLookup", Caller().with("otherIdLookup"), other("2"), kDone},
      {"otherIdLookup", Caller().with("otherIdLookup"), create("7", "com.example.new"), kDone},
      {"number 1", Caller().with("otherIdLookup", 1), other("2"), kDone},
      {"number 0", Caller().with("otherIdLookup", 0), other("2"), kRefused},
      {"false", Caller().with("otherIdLookup", false), other("2"), kRefused},
      {"string", Caller().with("otherIdLookup", "true"), other("2"), kRefused},
      {"array", Caller().with("otherIdLookup", Array{true}), other("2"), kRefused},
      {"allowed", Caller().with("allowed"), other("2"), kDone},
      {"allowed, a string", Caller().with("allowed", "true"), other("2"), kRefused},
      {"allowed, a dictionary", Caller().with("allowed", Dictionary{}), other("2"), kRefused},
      {"a short name", unprefixed, other("2"), kRefused},

      {"own system container", plain, {"create", "--class", "12"}, kRefused},
      {"another's system container", plain, other("12"), kRefused},
      {"well-known, by command 0", plain, create("12", "com.veltra.exampled"), kRefused},
      {"own in the lookup",
       lookingUp(Dictionary{{"systemData", Array{"com.example.app"}}}),
       {"create", "--class", "12"},
       kDone},
      {"lookup", lookingUp(Dictionary{{"systemData", otherOnly}}), other("12"), kDone},
      {"lookup of the group", lookingUp(Dictionary{{"systemGroup", otherOnly}}), other("12"),
       kRefused},
      {"lookup of the group", lookingUp(Dictionary{{"systemGroup", otherOnly}}), other("13"),
       kDone},
      {"otherIdLookup", Caller().with("otherIdLookup"), other("12"), kDone},
      {"allowed", Caller().with("allowed"), other("12"), kDone},
      {"any by its name", named("com.veltra.vaultd"), other("12"), kDone},

      {"the widget", named("com.veltra.examplewidget"), create("2", "com.veltra.exampleapp"),
       kDone},
      {"the widget", named("com.veltra.examplewidget"), create("4", "com.veltra.exampleapp"),
       kRefused},
      {"the widget", named("com.veltra.examplewidget"), other("2"), kRefused},
      {"not the widget", named("com.veltra.examplewidget.x"), create("2", "com.veltra.exampleapp"),
       kRefused},
      {"the seeker", named("com.veltra.seekerd"), create("2", "com.veltra.notebook"), kDone},
      {"the seeker", named("com.veltra.seekerd"), create("2", "com.veltra.exampleapp"), kRefused},
      {"the shelf", named("com.veltra.shelfd"), create("7", "group.com.veltra.shelf"), kDone},
      {"the shelf", named("com.veltra.shelfd"), create("2", "group.com.veltra.shelf"), kRefused},
      {"the installer", named("com.veltra.hatcheryd"), other("1"), kDone},
      {"the installer", named("com.veltra.hatcheryd"), other("2"), kDone},
      {"the installer", named("com.veltra.hatcheryd"), other("12"), kDone},
      {"the installer", named("com.veltra.hatcheryd"), create("13", "com.example.new"), kDone},
      {"anyone", plain, create("10", "com.veltra.beacond"), kDone},
      {"anyone", plain, create("2", "com.veltra.beacond"), kRefused},
  });
  EXPECT_EQ(device_->lookup(installer, "com.example.new", 2).code, kNotFound)
      << "what was refused has been made";
  EXPECT_NE(device_->daemonLog().find("com.example.app not entitled to retrieve container class 2 "
                                      "with identifier com.example.other"),
            std::string::npos);
}

TEST_F(Rights, OfTheCallerOverTheOtherCommands) {
  device_->start();
  ASSERT_EQ(device_->create(privilegedCaller(), "com.example.other", 12).code, kDone);
  const Caller plain;
  const Caller allowed = Caller().with("allowed");
  const Caller otherIds = Caller().with("otherIdLookup");
  const Caller emptyLookup = lookingUp(Dictionary{});
  const Caller systemLookup =
      lookingUp(Dictionary{{"systemData", Array{"com.example.other", "com.example.app"}}});
  const Arguments list{"list", "--class", "2"};
  const Arguments ownPath{"system-path"};
  const Arguments otherPath{"system-path", "com.example.other"};
  const Arguments wellknownPath{"system-path", "com.veltra.exampled"};
  check({
      {"plain", plain, list, kRefused},
      {"otherIdLookup", otherIds, list, kRefused},
      {"lookup", emptyLookup, list, kDone},
      {"lookup, an array", lookingUp(Array{}), list, kRefused},
      {"allowed", allowed, list, kDone},
      {"allowed 1", Caller().with("allowed", 1), list, kDone},
      {"allowed 0", Caller().with("allowed", 0), list, kRefused},

      {"plain", plain, ownPath, kRefused},
      {"plain", plain, otherPath, kRefused},
      {"plain", plain, wellknownPath, kDone},
      {"lookup", systemLookup, ownPath, kDone},
      {"lookup", systemLookup, otherPath, kDone},
      {"empty lookup", emptyLookup, otherPath, kRefused},
      {"otherIdLookup", otherIds, otherPath, kDone},
      {"allowed", allowed, ownPath, kDone},

      {"plain", plain, {"retired"}, kRefused},
      {"lookup", systemLookup, {"retired"}, kRefused},
      {"otherIdLookup", otherIds, {"retired"}, kRefused},
      {"allowed", allowed, {"retired"}, kInvalidCommand},

      {"plain", plain, {"personas"}, kDone},
  });
  EXPECT_EQ(device_->ask(plain, wellknownPath).text("path"),
            device_->path("/private/var/containers/Data/System/com.veltra.exampled"));
}

// Each entitlement opens its own rows of the table and no others.
TEST_F(Rights, OfEachEntitlementOverTheRows) {
  device_->start();
  std::vector<uint64_t> notTestability;
  std::vector<uint64_t> every;
  for (uint64_t command = 0; command < kCommandCount; ++command) {
    every.push_back(command);
    if (command != 25 && command != 31) notTestability.push_back(command);
  }
  const std::vector<uint64_t> forAnybody = {0, 13, 15, 16, 17, 28, 32};
  const struct {
    const char* what;
    Caller caller;
    std::vector<uint64_t> opened;
  } kGrants[] = {
      {"nothing", Caller(), {}},
      {"lookup", lookingUp(Dictionary{}), {1, 14, 23}},
      {"otherIdLookup", Caller().with("otherIdLookup"), {}},
      {"userManagedAssets", Caller().with("userManagedAssets"), {4, 28, 29}},
      {"wipeContainer, a list", Caller().with("wipeContainer", Array{}), {11}},
      {"wipeContainer, no list", Caller().with("wipeContainer"), {}},
      {"deleteContainerContent", Caller().with("deleteContainerContent"), {12}},
      {"dataMigration", Caller().with("dataMigration"), {24}},
      {"testability", Caller().with("testability"), {25, 31}},
      {"stageSharedContent", Caller().with("stageSharedContent"), {26}},
      {"allowed", Caller().with("allowed"), notTestability},
      {"allowed and testability", Caller().with("allowed").with("testability"), every},
  };
  // The rows that have an operation; the others say so to whoever may use them.
  const std::vector<uint64_t> built = {0, 1, 15, 27, 32};
  const auto contains = [](const std::vector<uint64_t>& list, uint64_t command) {
    return std::find(list.begin(), list.end(), command) != list.end();
  };
  for (const auto& grant : kGrants) {
    tessary::Client client = accepted(grant.caller);
    for (uint64_t command = 0; command < kCommandCount; ++command) {
      // A well-known name: what anybody may ask of command 15.
      const uint64_t code =
          codeOf(client, command, Message({{"Identifier", "com.veltra.exampled"}}));
      const bool open = contains(forAnybody, command) || contains(grant.opened, command);
      EXPECT_EQ(code != kRefused, open) << grant.what << ", command " << command;
      if (open && !contains(built, command)) {
        EXPECT_EQ(code, kInvalidCommand) << grant.what << ", command " << command;
      }
    }
  }
}

// Keys of the wrong type read as missing ones, and numbers out of range reach no handler.
TEST_F(Rights, StrangeRequestsAreAnswered) {
  device_->start();
  tessary::Client client = accepted(Caller().with("allowed"));
  for (const uint64_t command : {kCommandCount, uint64_t{34}, uint64_t{1} << 32U,
                                 (uint64_t{1} << 32U) + 1, uint64_t{1} << 63U, kHuge}) {
    EXPECT_EQ(codeOf(client, command, Message()), kInvalidCommand) << command;
  }
  const auto create = [](Value identifier, Value containerClass) {
    return Message({{"Identifier", std::move(identifier)},
                    {"ContainerClass", std::move(containerClass)},
                    {"CreateIfNecessary", true}});
  };
  const std::string name = "com.example.new";
  for (const Value& wrong : {Value(0), Value(14), Value(kHuge), Value(-1), Value("2"), Value(2.0),
                             Value(true), Value(Array{2})}) {
    EXPECT_EQ(codeOf(client, 0, create(name, wrong)), kUnexpectedClass) << wrong.description();
  }
  EXPECT_EQ(codeOf(client, 0, Message({{"Identifier", name}})), kUnexpectedClass);
  for (const Value& wrong : {Value(5), Value(), Value(true), Value(Array{name}),
                             Value(Value::Data{'a'}), Value(Dictionary{})}) {
    const auto reply = client.call(0, create(wrong, 2));
    ASSERT_TRUE(reply) << wrong.description();
    EXPECT_EQ(*reply->string("ReplyIdentifier"), "com.example.app") << wrong.description();
  }
  const Message onlyWanted({{"Identifier", name}, {"ContainerClass", 2}, {"CreateIfNecessary", 1}});
  EXPECT_EQ(codeOf(client, 0, onlyWanted), kNotFound) << "1 is not true";

  // What is no command number reads as 0.
  auto channel = platform::ipc::Channel::connect(device_->path("/run/tessary/com.veltra.tessaryd"));
  ASSERT_TRUE(channel);
  for (const Value& wrong : {Value("27"), Value(-1), Value(27.0), Value()}) {
    const auto reply = channel->call(Message({{"Command", wrong}, {"Identifier", name}}));
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->uint64("ReplyError"), kUnexpectedClass) << wrong.description();
  }
}

TEST_F(Rights, ARequestWithoutReplyContextEndsItsConnection) {
  device_->start();
  ASSERT_TRUE(accepted(privilegedCaller()).personaList());  // leaves the record in place
  const auto socket =
      platform::ipc::connectTo(device_->path("/run/tessary/com.veltra.tessaryd"), SOCK_STREAM);
  ASSERT_TRUE(socket);
  std::vector<uint8_t> bytes;
  for (const uint32_t sequence : {0U, 1U}) {
    const Message request({{"Command", 0},
                           {"Identifier", "com.example.unanswered"},
                           {"ContainerClass", 2},
                           {"CreateIfNecessary", true}});
    const auto frame = platform::ipc::encodeFrame(request, sequence, 0);
    bytes.insert(bytes.end(), frame->begin(), frame->end());
  }
  ASSERT_EQ(::send(socket->get(), bytes.data(), bytes.size(), MSG_NOSIGNAL),
            static_cast<ssize_t>(bytes.size()));
  pollfd poll{socket->get(), POLLIN, 0};
  ASSERT_EQ(::poll(&poll, 1, 30'000), 1) << "the connection is still open";
  char byte = 0;
  const ssize_t count = ::recv(socket->get(), &byte, 1, 0);
  EXPECT_TRUE(count == 0 || (count < 0 && errno == ECONNRESET)) << "a reply came: " << count;
  EXPECT_NE(device_->daemonLog().find("Dictionary does not have reply context"), std::string::npos);
  EXPECT_EQ(device_->lookup(privilegedCaller(), "com.example.unanswered", 2).code, kNotFound);
}

// --- Who the caller is --------------------------------------------------------------------------

TEST_F(Rights, AProcessWithoutARecordIsNobody) {
  device_->start();
  const auto askWithoutRecord = [&](const Arguments& arguments) {
    Arguments command = {"/usr/bin/env", "setpriv",        "--reuid=501",
                         "--regid=501",  "--clear-groups", Device::program("tessaryctl"),
                         "--root",       device_->root()};
    command.insert(command.end(), arguments.begin(), arguments.end());
    return runToEnd(command);
  };
  const struct {
    Arguments arguments;
    uint64_t code;
  } kCases[] = {
      {{"create", "--class", "2"}, kNoIdentifier},
      {{"create", "--class", "2", "com.example.app"}, kNoUserIdentity},
      {{"create", "--class", "2", ""}, kNoUserIdentity},
      {{"create", "--class", "12", "com.veltra.exampled"}, kNoUserIdentity},
      {{"create", "--class", "10", "com.veltra.beacond"}, kNoUserIdentity},
      {{"list", "--class", "2"}, kRefused},
      {{"system-path"}, kNoIdentifier},
      {{"system-path", "com.veltra.exampled"}, kNoUserIdentity},
      {{"retired"}, kRefused},
  };
  for (const auto& [arguments, code] : kCases) {
    const Finished finished = askWithoutRecord(arguments);
    EXPECT_NE(finished.errors.find(fmt::format("({})", code)), std::string::npos)
        << fmt::format("{}", fmt::join(arguments, " ")) << ": " << finished.errors;
  }
  const Finished personas = askWithoutRecord({"personas"});
  EXPECT_EQ(personas.exitStatus, 0) << personas.errors;
  EXPECT_EQ(personas.output, "");
}

// A record that anybody else may have written, or that is another process's, gives nothing.
TEST_F(Rights, OnlyTheLaunchersRecordIsBelieved) {
  device_->start();
  const std::string directory = device_->path("/run/tessary/tasks");
  const uint64_t startTime = *platform::processStartTime(::getpid());
  const std::string record = fmt::format("{}/{}.{}.plist", directory, ::getpid(), startTime);
  const std::string aside = device_->path("/aside.plist");
  const struct {
    const char* what;
    std::function<void()> spoil;
    uint64_t code;
  } kCases[] = {
      {"as it was written", [] {}, kDone},
      {"a user's", [&] { (void)::chown(record.c_str(), kMobile, kMobile); }, kNoIdentifier},
      {"writable by a group", [&] { ::chmod(record.c_str(), 0660); }, kNoIdentifier},
      {"writable by all", [&] { ::chmod(record.c_str(), 0602); }, kNoIdentifier},
      {"in a user's directory", [&] { (void)::chown(directory.c_str(), kMobile, kMobile); },
       kNoIdentifier},
      {"in a directory writable by all", [&] { ::chmod(directory.c_str(), 0777); }, kNoIdentifier},
      {"a link to a good one",
       [&] {
         std::filesystem::rename(record, aside);
         std::filesystem::create_symlink(aside, record);
       },
       kNoIdentifier},
      {"a FIFO",
       [&] {
         std::filesystem::remove(record);
         ::mkfifo(record.c_str(), 0600);
       },
       kNoIdentifier},
      {"cut short", [&] { std::filesystem::resize_file(record, 20); }, kNoIdentifier},
      {"of an earlier process with the pid",
       [&] {
         std::filesystem::rename(
             record, fmt::format("{}/{}.{}.plist", directory, ::getpid(), startTime - 1));
       },
       kNoIdentifier},
      {"of another process",
       [&] {
         std::filesystem::rename(record,
                                 fmt::format("{}/{}.{}.plist", directory, ::getppid(), startTime));
       },
       kNoIdentifier},
      {"written again", [] {}, kDone},
  };
  for (const auto& [what, spoil, code] : kCases) {
    std::filesystem::remove_all(directory);
    (void)accepted(privilegedCaller());
    spoil();
    auto client = tessary::Client::connect(device_->root());
    ASSERT_TRUE(client) << what;
    EXPECT_EQ(codeOf(*client, 0, Message({{"ContainerClass", 2}, {"CreateIfNecessary", true}})),
              code)
        << what;
    EXPECT_EQ(codeOf(*client, 27, Message()), code == kDone ? kInvalidCommand : kRefused) << what;
  }
  EXPECT_NE(device_->systemLog().find("is not believed: others could write it"), std::string::npos);
}

// The daemon remembers the installer's identity: of the one process, not of the name.
TEST_F(Rights, OneInstallerDoesNotLendItsRightsToAnother) {
  device_->start();
  const Caller weak = named("com.veltra.hatcheryd");
  const Caller strong = weak.with("allowed");
  tessary::Client remembered = accepted(strong);
  for (int i = 0; i < 3; ++i) {
    EXPECT_EQ(codeOf(remembered, 27, Message()), kInvalidCommand);
    EXPECT_EQ(device_->ask(weak, {"retired"}).code, kRefused);
    EXPECT_EQ(device_->ask(strong, {"retired"}).code, kInvalidCommand);
    EXPECT_EQ(device_->ask(Caller(), {"retired"}).code, kRefused);
  }
}

// --- Sandbox tokens -----------------------------------------------------------------------------

TEST_F(Rights, TokensOpenEnterpriseContainersToSandboxedProcesses) {
  device_->setPersonas({{"P", 100, "personal", "", {}},
                        {"W", 101, "enterprise", "/private/var/work", {"com.example.mixed"}}});
  device_->start();
  const platform::Sandbox sandbox(device_->files());
  const auto token =
      platform::AuditToken::make(0, 0, ::getpid(), *platform::processStartTime(::getpid()));
  Caller worker = Caller().with("allowed");
  worker.sandboxed = true;
  worker.persona = "W";
  const struct {
    const char* who;
    std::optional<std::string> persona;
    bool sandboxed;
    std::vector<tessary::ContainerClass> withToken;
  } kCases[] = {
      {"at work", "W", true, {2, 4, 6, 7, 10}},
      {"at work, not sandboxed", "W", false, {}},
      {"at home", "P", true, {}},
      {"without a persona", std::nullopt, true, {}},
  };
  for (const auto& [who, persona, sandboxed, withToken] : kCases) {
    worker.persona = persona;
    worker.sandboxed = sandboxed;
    tessary::Client client = accepted(worker);
    for (tessary::ContainerClass containerClass = 1; containerClass <= 13; ++containerClass) {
      const auto found =
          client.createOrLookup(std::nullopt, containerClass, {.createIfNecessary = true});
      ASSERT_TRUE(found) << who << containerClass << ": " << found.error().code;
      const bool wanted =
          std::find(withToken.begin(), withToken.end(), containerClass) != withToken.end();
      ASSERT_EQ(found->sandboxToken.has_value(), wanted) << who << ", class " << containerClass;
      if (!wanted) continue;
      const std::string& text = *found->sandboxToken;
      const bool isGroup = containerClass == 7;
      const std::string begins =
          fmt::format("com.veltra.sandbox.{};{};{};", isGroup ? "application-group" : "container",
                      ::getpid(), found->path);
      EXPECT_TRUE(text.starts_with(begins)) << text;
      EXPECT_TRUE(sandbox.verifyExtension(text, token)) << text;
      auto another = token;
      ++another.words[6];
      EXPECT_FALSE(sandbox.verifyExtension(text, another)) << "for a process of another time";
      std::string elsewhere = text;
      elsewhere.replace(begins.size() - 2, 1, "x");
      EXPECT_FALSE(sandbox.verifyExtension(elsewhere, token)) << elsewhere;
    }
  }
  // A process without a persona is given the application's own, and then a token too.
  worker.persona = std::nullopt;
  worker.sandboxed = true;
  worker.identifier = "com.example.mixed";
  EXPECT_TRUE(device_->create(worker, "", 2).json.contains("sandboxToken"));
}

}  // namespace
