// Who may do what: real processes with different identifiers and entitlements ask the real daemon.
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <limits>
#include <sstream>
#include <vector>

#include "Platform/ipc/Codec.h"
#include "Platform/ipc/SocketPath.h"
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

Caller lookingUp(Value lists) {
  return Caller().with("lookup", std::move(lists));
}

class Rights : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "processes of several users are needed";
    device_.emplace();
  }

  struct Case {
    const char* who;
    Caller caller;
    std::string question;  // the words of a command line of tessaryctl
    uint64_t code;
  };
  void check(const std::vector<Case>& cases) const {
    for (const Case& one : cases) {
      const Answer answer = device_->ask(one.caller, words(one.question));
      EXPECT_EQ(answer.code, one.code) << one.who << ": " << one.question << "\n" << answer.errors;
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
  const std::string other1 = "lookup --class 1 com.example.other";
  const std::string other2 = "lookup --class 2 com.example.other";
  const std::string other12 = "lookup --class 12 com.example.other";
  const std::string create = "create --class ";
  const std::string otherPath = "system-path com.example.other";
  const std::string wellknownPath = "system-path com.veltra.exampled";
  const Value otherOnly = Array{"com.example.other"};
  const auto list = [](const char* key, Value names) {
    return lookingUp(Dictionary{{key, std::move(names)}});
  };
  const auto otherIds = [](Value value) { return Caller().with("otherIdLookup", value); };
  const Caller widget = named("com.veltra.examplewidget");
  const Caller seeker = named("com.veltra.seekerd");
  const Caller shelf = named("com.veltra.shelfd");
  const Caller hatchery = named("com.veltra.hatcheryd");
  Caller unprefixed;
  unprefixed.entitlements.emplace("allowed", true);
  check({
      {"own", plain, create + "2", kDone},
      {"own, by name", plain, create + "2 com.example.app", kDone},
      {"own bundle", plain, create + "1", kDone},
      {"own group", plain, create + "13", kDone},
      {"another's", plain, other2, kRefused},
      {"another's bundle", plain, other1, kRefused},
      {"another's group", plain, "lookup --class 7 com.example.other", kRefused},
      {"another's, to be made", plain, create + "2 com.example.new", kRefused},
      {"by case", plain, create + "2 com.example.App", kRefused},

      {"lookup", list("appData", otherOnly), other2, kDone},
      {"another class's list", list("pluginData", otherOnly), other2, kRefused},
      {"a class's number", list("2", otherOnly), other2, kRefused},
      {"no list", list("appData", "com.example.other"), other2, kRefused},
      {"a dictionary", list("appData", Dictionary{{"com.example.other", true}}), other2, kRefused},
      {"no strings", list("appData", Array{1, true, otherOnly}), other2, kRefused},
      {"strings too", list("appData", Array{1, "com.example.other"}), other2, kDone},
      {"no dictionary", lookingUp(Array{"appData", "com.example.other"}), other2, kRefused},

      {"otherIdLookup", otherIds(true), other2, kDone},
      {"otherIdLookup", otherIds(true), create + "7 com.example.new", kDone},
      {"number 1", otherIds(1), other2, kDone},
      {"number 0", otherIds(0), other2, kRefused},
      {"false", otherIds(false), other2, kRefused},
      {"string", otherIds("true"), other2, kRefused},
      {"array", otherIds(Array{true}), other2, kRefused},
      {"allowed", Caller().with("allowed"), other2, kDone},
      {"allowed, a string", Caller().with("allowed", "true"), other2, kRefused},
      {"allowed, a dictionary", Caller().with("allowed", Dictionary{}), other2, kRefused},
      {"a short name", unprefixed, other2, kRefused},

      {"own system container", plain, create + "12", kRefused},
      {"another's system container", plain, other12, kRefused},
      {"well-known, by command 0", plain, create + "12 com.veltra.exampled", kRefused},
      {"own in the lookup", list("systemData", Array{plain.identifier}), create + "12", kDone},
      {"lookup", list("systemData", otherOnly), other12, kDone},
      {"lookup of the group", list("systemGroup", otherOnly), other12, kRefused},
      {"otherIdLookup", otherIds(true), other12, kDone},
      {"allowed", Caller().with("allowed"), other12, kDone},
      {"any by its name", named("com.veltra.vaultd"), other12, kDone},

      {"the widget", widget, create + "2 com.veltra.exampleapp", kDone},
      {"the widget", widget, create + "4 com.veltra.exampleapp", kRefused},
      {"the widget", widget, other2, kRefused},
      {"the seeker", seeker, create + "2 com.veltra.notebook", kDone},
      {"the seeker", seeker, create + "2 com.veltra.exampleapp", kRefused},
      {"the shelf", shelf, create + "7 group.com.veltra.shelf", kDone},
      {"the shelf", shelf, create + "2 group.com.veltra.shelf", kRefused},
      {"the installer", hatchery, other1, kDone},
      {"the installer", hatchery, other2, kDone},
      {"the installer", hatchery, create + "13 com.example.new", kDone},
      {"anyone", plain, create + "10 com.veltra.beacond", kDone},
      {"anyone", plain, create + "2 com.veltra.beacond", kRefused},

      {"own path", plain, "system-path", kRefused},
      {"another's path", plain, otherPath, kRefused},
      {"a well-known path", plain, wellknownPath, kDone},
      {"own path in the lookup", list("systemData", Array{plain.identifier}), "system-path", kDone},
      {"another's in the lookup", list("systemData", otherOnly), otherPath, kDone},
      {"an empty lookup", lookingUp(Dictionary{}), otherPath, kRefused},
      {"otherIdLookup", otherIds(true), otherPath, kDone},
      {"allowed", Caller().with("allowed"), "system-path", kDone},

      {"listing", lookingUp(Dictionary{}), "list --class 2", kDone},
      {"listing", lookingUp(Array{}), "list --class 2", kRefused},
      {"listing", otherIds(true), "list --class 2", kRefused},
      {"listing", Caller().with("allowed", 1), "list --class 2", kDone},
  });
  EXPECT_EQ(device_->ask(plain, words(wellknownPath)).text("path"),
            device_->path("/private/var/containers/Data/System/com.veltra.exampled"));
  EXPECT_EQ(device_->lookup(installer, "com.example.new", 2).code, kNotFound)
      << "what was refused has been made";
  EXPECT_NE(device_->daemonLog().find("com.example.app not entitled to retrieve container class 2 "
                                      "with identifier com.example.other"),
            std::string::npos);
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
          codeOf(client, command, Message(Dictionary{{"Identifier", "com.veltra.exampled"}}));
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
  EXPECT_EQ(codeOf(client, 0, Message(Dictionary{{"Identifier", name}})), kUnexpectedClass);
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
  const auto askWithoutRecord = [&](const std::string& question) {
    std::vector<std::string> command = words(
        "/usr/bin/env setpriv --reuid=501 --regid=501 "
        "--clear-groups");
    command.insert(command.end(), {Device::program("tessaryctl"), "--root", device_->root()});
    const std::vector<std::string> arguments = words(question);
    command.insert(command.end(), arguments.begin(), arguments.end());
    return runToEnd(command);
  };
  const std::pair<const char*, uint64_t> cases[] = {
      {"create --class 2", kNoIdentifier},
      {"create --class 2 com.example.app", kNoUserIdentity},
      {"create --class 10 com.veltra.beacond", kNoUserIdentity},
      {"create --class 12 com.veltra.exampled", kNoUserIdentity},
      {"list --class 2", kRefused},
      {"system-path", kNoIdentifier},
      {"system-path com.veltra.exampled", kNoUserIdentity},
      {"retired", kRefused},
  };
  for (const auto& [question, code] : cases) {
    const Finished finished = askWithoutRecord(question);
    EXPECT_NE(finished.errors.find(fmt::format("({})", code)), std::string::npos)
        << question << ": " << finished.errors;
  }
  const Finished personas = askWithoutRecord("personas");
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
