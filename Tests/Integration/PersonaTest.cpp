// Personas: whose a container is, what each persona sees, and what happens when the list of
// personas changes while clients are served.
#include <fmt/format.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <future>
#include <map>

#include "Platform/os/Notifications.h"
#include "Platform/os/SandboxLog.h"
#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/Integration/Watchdog.h"

using testing::UnorderedElementsAre;

namespace {

enum Code : uint64_t {
  kDone = 1,
  kNotFound = 21,
  kRebuildFailed = 43,
  kAddFailed = 45,
  kRefused = 55,
  kNoUserIdentity = 76
};

constexpr char kHome[] = "/private/var/mobile/";
constexpr char kWork[] = "/private/var/office/";
constexpr char kSecond[] = "/private/var/second/";
constexpr int kWorkID = 101;
constexpr uint32_t kDataItem = 1;  // the sandbox's number for data containers

const Device::Persona kPersonal{"P", 100, "personal", "", {}};
const Device::Persona kEnterprise{
    "W", kWorkID, "enterprise", "/private/var/office", {"com.example.work", "com.example.both"}};
const Device::Persona kOtherEnterprise{
    "S", 102, "enterprise", "/private/var/second", {"com.example.second", "com.example.both"}};
const Device::Persona kUniversal{"U", 103, "universal", "", {"com.example.mail"}};
const std::vector<Device::Persona> kAll = {kPersonal, kEnterprise, kOtherEnterprise, kUniversal};

using PersonaName = std::optional<std::string>;

Caller in(const PersonaName& persona) {
  Caller caller = privilegedCaller();
  caller.persona = persona;
  return caller;
}

class Personas : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "processes of several users are needed";
    device_.emplace();
    device_->setPersonas(kAll);
    device_->start();
  }

  tessary::Client connect(const PersonaName& persona) const {
    return device_->connect(in(persona));
  }
  std::vector<std::string> personaList(const PersonaName& persona) const {
    return connect(persona).personaList().value();
  }
  // "identifier persona" of each container listed.
  std::vector<std::string> listing(const PersonaName& persona,
                                   tessary::ContainerClass containerClass) const {
    std::vector<std::string> containers;
    const auto listed = connect(persona).containersOfClass(containerClass);
    EXPECT_TRUE(listed);
    for (const auto& one : *listed) {
      containers.push_back(one.identifier + " " + one.personaUniqueString);
    }
    return containers;
  }

  // What the sandbox has been told last of a data container.
  std::optional<std::string> mapped(int persona, const std::string& identifier) const {
    std::optional<std::string> path;
    std::ifstream log(platform::sandboxLogPath(device_->files()));
    for (std::string line; std::getline(log, line);) {
      const auto mapping = platform::parseMappingLine(line);
      if (mapping && mapping->uid == 501 && mapping->personaID == persona &&
          mapping->itemType == kDataItem && mapping->identifier == identifier) {
        path = mapping->path;
      }
    }
    return path;
  }
  uint64_t invalidations() const {
    std::ifstream file(device_->path("/run/tessary/notifications/") +
                       platform::notification::kUserInvalidated);
    uint64_t count = 0;
    file >> count;
    return count;
  }

  std::optional<Device> device_;
};

TEST_F(Personas, AContainerLiesInTheHomeOfItsPersona) {
  const struct {
    const char* what;
    PersonaName persona;  // of the client
    const char* identifier;
    tessary::ContainerClass containerClass;
    std::string home;
    const char* owner;  // the persona that the reply names
  } kCases[] = {
      {"the one persona's application", std::nullopt, "com.example.work", 2, kWork, "W"},
      {"its group", std::nullopt, "com.example.work", 7, kWork, "W"},
      {"two personas' application", std::nullopt, "com.example.both", 2, kHome, "P"},
      {"everybody's application", std::nullopt, "com.example.mail", 2, kHome, "P"},
      {"nobody's application", std::nullopt, "com.example.other", 2, kHome, "P"},
      {"at work", "W", "com.example.work", 2, kWork, "W"},
      {"at work, everybody's", "W", "com.example.mail", 2, kWork, "W"},
      {"at work, another's", "W", "com.example.second", 2, kWork, "W"},
      {"elsewhere, two personas'", "S", "com.example.both", 2, kSecond, "S"},
      {"at home, the work's", "P", "com.example.work", 2, kHome, "P"},
      {"in the universal persona", "U", "com.example.second", 2, kSecond, "S"},
      {"a bundle, which is nobody's", "W", "com.example.work", 1, "/private/var/containers/", ""},
  };
  std::map<std::string, std::string> paths;
  for (const bool isMade : {false, true}) {
    for (const auto& [what, persona, identifier, containerClass, home, owner] : kCases) {
      const Answer answer = isMade ? device_->lookup(in(persona), identifier, containerClass)
                                   : device_->create(in(persona), identifier, containerClass);
      const std::string path = answer.text("path");
      EXPECT_TRUE(path.starts_with(device_->path(home))) << what << path << answer.errors;
      EXPECT_EQ(answer.text("persona"), owner) << what;
      // Whoever comes to the same home finds the same container.
      const std::string where = fmt::format("{}{}{}", home, identifier, containerClass);
      EXPECT_EQ(paths.emplace(where, path).first->second, path) << what;
    }
    device_->stop();
    device_->start();
  }
  EXPECT_EQ(device_->create(in("X"), "com.example.work", 2).code, kNoUserIdentity);
  EXPECT_THAT(listing("W", 2), UnorderedElementsAre("com.example.work W", "com.example.mail W",
                                                    "com.example.second W"));
  EXPECT_EQ(listing(std::nullopt, 2).size(), 9U);
  EXPECT_EQ(listing(std::nullopt, 1).size(), 1U) << "what belongs to no user is listed once";
  EXPECT_THAT(personaList("U"), UnorderedElementsAre("P", "S", "W"));
  EXPECT_THAT(personaList("W"), UnorderedElementsAre("W"));
}

TEST_F(Personas, APersonaThatGoesTakesItsMappingsAndEntriesAlong) {
  tessary::Client worker = connect("W");
  const auto make = [](tessary::Client& client, const std::string& identifier) {
    return client.createOrLookup(identifier, 2, {.createIfNecessary = true})->path;
  };
  const std::string work = make(worker, "com.example.work");
  const std::string gone = make(worker, "com.example.both");
  tessary::Client other = connect("S");
  const std::string second = make(other, "com.example.second");
  ASSERT_EQ(mapped(kWorkID, "com.example.work"), work);

  device_->setPersonas({kPersonal, kOtherEnterprise, kUniversal});
  ASSERT_TRUE(becomes([&] { return personaList(std::nullopt).size() == 2; }));
  EXPECT_TRUE(becomes([&] { return !mapped(kWorkID, "com.example.work"); }));
  EXPECT_TRUE(becomes([&] { return invalidations() == 2; })) << "once for each of the two";
  const auto refused = worker.createOrLookup("com.example.work", 2);
  EXPECT_EQ(refused ? kDone : refused.error().code, kNoUserIdentity);
  // The other one has only been forgotten: what asks for it finds it again.
  EXPECT_EQ(other.createOrLookup("com.example.second", 2)->path, second);
  EXPECT_EQ(mapped(102, "com.example.second"), second);

  // The disk has changed when the persona comes back.
  std::filesystem::remove_all(gone);
  const std::string moved = work.substr(0, work.rfind('/') + 1) + platform::UUID::random().string();
  std::filesystem::rename(work, moved);
  device_->setPersonas(kAll);
  ASSERT_TRUE(becomes([&] { return personaList(std::nullopt).size() == 3; }));
  EXPECT_EQ(worker.createOrLookup("com.example.work", 2)->path, moved);
  EXPECT_EQ(mapped(kWorkID, "com.example.work"), moved);
  EXPECT_EQ(worker.createOrLookup("com.example.both", 2).error().code, kNotFound);
}

// Clients go on asking while the list changes under them: every request is answered, and none that
// comes at a bad moment makes the daemon forget a container, or make it twice.
TEST_F(Personas, ClientsAreServedWhileTheListChanges) {
  constexpr unsigned kChanges = 40;
  const std::vector<std::string> applications = {"com.example.both", "com.example.work"};
  std::map<std::string, std::string> paths;  // of the persona that comes and goes
  for (const std::string& application : applications) {
    paths[application] = device_->create(in("W"), application, 2).text("path");
  }
  std::atomic<bool> enough = false;
  std::atomic<unsigned> answered = 0;
  // Returns what was wrong.
  const auto ask = [&](tessary::Client& client, size_t number) {
    std::string wrong;
    const auto judge = [&](const auto& result) {
      ++answered;
      // A persona may go before the request or in the middle of it.
      const uint64_t code = result ? uint64_t{kDone} : result.error().code;
      const std::set<uint64_t> fine = {kDone, kNoUserIdentity, kRefused, kRebuildFailed,
                                       kAddFailed};
      if (!fine.contains(code)) wrong += fmt::format("{} {}; ", result.error().text, code);
    };
    for (unsigned round = 0; !enough && wrong.empty(); ++round) {
      judge(client.createOrLookup(applications[round % 2], 2, {.createIfNecessary = true}));
      judge(client.createOrLookup(fmt::format("com.example.{}.{}", number, round % 8), 7,
                                  {.createIfNecessary = true}));
      judge(client.systemContainerPath("com.veltra.exampled"));
      judge(client.personaList());
      judge(client.containersOfClass(2));
    }
    return wrong;
  };
  tessary::Client watcher = connect(std::nullopt);
  std::vector<tessary::Client> clients;
  for (const PersonaName& persona :
       std::vector<PersonaName>{"W", "S", "P", std::nullopt, "W", std::nullopt}) {
    clients.push_back(connect(persona));
  }
  std::vector<std::future<std::string>> threads;
  for (size_t i = 0; i < clients.size(); ++i) {
    threads.push_back(std::async(std::launch::async, ask, std::ref(clients[i]), i));
  }
  for (unsigned change = 1; change <= kChanges && !HasFailure(); ++change) {
    const Watchdog watchdog(*device_);
    const unsigned seen = answered;
    const bool without = change % 2 == 1;
    device_->setPersonas(without ? std::vector{kPersonal, kOtherEnterprise} : kAll);
    EXPECT_TRUE(becomes([&] {
      const auto list = watcher.personaList();
      return list && list->size() == (without ? 2 : 3) && answered > seen + 20;
    }));
  }
  enough = true;
  for (auto& thread : threads) EXPECT_EQ(thread.get(), "");

  EXPECT_TRUE(becomes([&] { return invalidations() == kChanges / 2 * 3; }))
      << "both enterprise personas go, or the one that is there: " << invalidations();
  EXPECT_EQ(itemsIn(*device_, kWork + std::string("Containers/Data/Application")).size(), 2U);
  for (const auto& [application, path] : paths) {
    EXPECT_EQ(device_->lookup(in("W"), application, 2).text("path"), path);
    EXPECT_EQ(mapped(kWorkID, application), path);
  }
  for (const char* persona : {"W", "S", "P"}) {
    const auto listed = listing(persona, 2);
    EXPECT_EQ(std::ranges::count(listed, std::string("com.example.both ") + persona), 1);
  }
  EXPECT_EQ(device_->stop(), 0);
}

TEST_F(Personas, TheLastGoodListStaysWhenTheFileBreaks) {
  const std::string path = device_->path("/etc/tessary/personas.plist");
  // Another list, for a link that must not be followed.
  const std::string good = device_->path("/etc/good.plist");
  device_->setPersonas({kPersonal});
  std::filesystem::rename(path, good);
  device_->setPersonas(kAll);
  ASSERT_TRUE(becomes([&] { return personaList(std::nullopt).size() == 3; }));
  const uint64_t before = invalidations();
  const std::function<void()> breakages[] = {
      [&] { std::ofstream(path) << "nonsense"; },
      [&] { device_->setPersonas({kPersonal, kPersonal}); },
      [&] { std::filesystem::remove(path); },
      [&] {
        std::filesystem::create_symlink(good, path + ".link");
        std::filesystem::rename(path + ".link", path);
      },
  };
  for (size_t i = 0; i < std::size(breakages); ++i) {
    const size_t logged = device_->systemLog().size();
    breakages[i]();
    ASSERT_TRUE(becomes([&] {
      return device_->systemLog().find("the last good list stays", logged) != std::string::npos;
    })) << i;
    EXPECT_EQ(personaList(std::nullopt).size(), 3U) << i;
  }
  EXPECT_EQ(invalidations(), before);
  std::filesystem::remove(path);
  device_->setPersonas({kPersonal});
  EXPECT_TRUE(becomes([&] { return personaList(std::nullopt).size() == 1; }));
}

}  // namespace
