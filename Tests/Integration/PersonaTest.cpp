// Personas: whose a container is, what each persona sees, and what happens when the list of
// personas changes while clients are served.
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <map>
#include <thread>

#include "Platform/os/Notifications.h"
#include "Platform/os/SandboxLog.h"
#include "Tests/Integration/Device.h"

namespace {

enum Code : uint64_t {
  kDone = 1,
  kNoIdentifier = 18,
  kNotFound = 21,
  kRebuildFailed = 43,
  kAddFailed = 45,
  kRefused = 55,
  kNoUserIdentity = 76
};

constexpr char kHome[] = "/private/var/mobile";
constexpr char kWork[] = "/private/var/work";
constexpr char kSecond[] = "/private/var/second";
constexpr int kWorkID = 101;
constexpr uint32_t kDataItem = 1;  // the sandbox's number for data containers

const Device::Persona kPersonal{"P", 100, "personal", "", {}};
const Device::Persona kEnterprise{
    "W", kWorkID, "enterprise", kWork, {"com.example.work", "com.example.both"}};
const Device::Persona kOtherEnterprise{
    "S", 102, "enterprise", kSecond, {"com.example.second", "com.example.both"}};
const Device::Persona kUniversal{"U", 103, "universal", "", {"com.example.mail"}};
const std::vector<Device::Persona> kAll = {kPersonal, kEnterprise, kOtherEnterprise, kUniversal};

Caller in(const std::optional<std::string>& persona) {
  Caller caller = privilegedCaller();
  caller.persona = persona;
  return caller;
}

class Personas : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "processes of several users are needed";
    device_.emplace();
  }

  static bool becomes(const std::function<bool()>& condition) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (!condition()) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
  }

  tessary::Client accepted(const Caller& caller) const {
    tessary::Client client = device_->connect(caller);
    EXPECT_TRUE(client.personaList());
    return client;
  }
  std::vector<std::string> personaList(const std::optional<std::string>& persona) const {
    auto list = accepted(in(persona)).personaList().value();
    std::sort(list.begin(), list.end());
    return list;
  }
  bool listBecomes(std::vector<std::string> expected) const {
    std::sort(expected.begin(), expected.end());
    return becomes([&] { return personaList(std::nullopt) == expected; });
  }
  // The identifiers of a listing, with repetitions, and their personas.
  std::multimap<std::string, std::string> listing(const std::optional<std::string>& persona,
                                                  tessary::ContainerClass containerClass) const {
    std::multimap<std::string, std::string> containers;
    const auto listed = accepted(in(persona)).containersOfClass(containerClass);
    EXPECT_TRUE(listed);
    for (const auto& one : *listed) containers.emplace(one.identifier, one.personaUniqueString);
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
  device_->setPersonas(kAll);
  device_->start();
  constexpr char kGlobal[] = "/private/var/containers";
  const struct {
    const char* what;
    std::optional<std::string> persona;  // of the client
    const char* identifier;
    tessary::ContainerClass containerClass;
    const char* home;
    std::optional<std::string> owner;  // the persona that the reply names
  } kCases[] = {
      {"the one persona's application", std::nullopt, "com.example.work", 2, kWork, "W"},
      {"its group", std::nullopt, "com.example.work", 7, kWork, "W"},
      {"another one's", std::nullopt, "com.example.second", 10, kSecond, "S"},
      {"two personas' application", std::nullopt, "com.example.both", 2, kHome, "P"},
      {"everybody's application", std::nullopt, "com.example.mail", 2, kHome, "P"},
      {"nobody's application", std::nullopt, "com.example.other", 2, kHome, "P"},
      {"at work", "W", "com.example.work", 2, kWork, "W"},
      {"at work, two personas'", "W", "com.example.both", 2, kWork, "W"},
      {"at work, everybody's", "W", "com.example.mail", 2, kWork, "W"},
      {"at work, nobody's", "W", "com.example.other", 2, kWork, "W"},
      {"at work, another's", "W", "com.example.second", 2, kWork, "W"},
      {"elsewhere, two personas'", "S", "com.example.both", 2, kSecond, "S"},
      {"at home, the work's", "P", "com.example.work", 2, kHome, "P"},
      {"in the universal persona", "U", "com.example.second", 2, kSecond, "S"},
      {"a bundle, which is nobody's", std::nullopt, "com.example.work", 1, kGlobal, ""},
  };
  std::map<std::string, std::string> uuids;
  for (const auto& one : kCases) {
    const Answer made = device_->create(in(one.persona), one.identifier, one.containerClass);
    ASSERT_EQ(made.code, kDone) << one.what << made.errors;
    EXPECT_TRUE(made.text("path").starts_with(device_->path(one.home) + "/"))
        << one.what << ": " << made.text("path");
    EXPECT_EQ(made.text("persona"), one.owner) << one.what;
    // Whoever comes to the same home finds the same container.
    const std::string where = fmt::format("{}{}{}", one.home, one.identifier, one.containerClass);
    EXPECT_EQ(uuids.emplace(where, made.text("uuid")).first->second, made.text("uuid")) << one.what;
  }
  struct stat status{};
  ASSERT_EQ(
      ::stat(device_->path(kWork + std::string("/Containers/Data/Application")).c_str(), &status),
      0);
  EXPECT_EQ(status.st_uid, 501U);
  EXPECT_NE(device_->systemLog().find("Ambiguous user identity from [com.example.both]"),
            std::string::npos);
  // A persona that nobody knows is no identity.
  EXPECT_EQ(device_->create(in("X"), "com.example.work", 2).code, kNoUserIdentity);
  EXPECT_EQ(device_->create(in("X"), "", 2).code, kNoIdentifier);

  ASSERT_EQ(device_->stop(), 0);
  device_->start();
  for (const auto& one : kCases) {
    const Answer found = device_->lookup(in(one.persona), one.identifier, one.containerClass);
    EXPECT_EQ(found.code, kDone) << one.what << found.errors;
    EXPECT_TRUE(found.text("path").starts_with(device_->path(one.home) + "/")) << one.what;
  }
}

TEST_F(Personas, EachSeesItsOwnAndTheUnspecificClientAllOnce) {
  device_->setPersonas(kAll);
  device_->start();
  EXPECT_EQ(personaList(std::nullopt), (std::vector<std::string>{"P", "S", "W"}));
  EXPECT_EQ(personaList("U"), (std::vector<std::string>{"P", "S", "W"}));
  EXPECT_EQ(personaList("W"), std::vector<std::string>{"W"});
  EXPECT_EQ(personaList("P"), std::vector<std::string>{"P"});
  EXPECT_EQ(personaList("X"), std::vector<std::string>{});

  for (const char* persona : {"P", "W", "S"}) {
    for (const tessary::ContainerClass containerClass : std::vector<uint64_t>{1, 2, 12}) {
      ASSERT_EQ(device_->create(in(persona), "com.example.both", containerClass).code, kDone);
    }
    ASSERT_EQ(device_->create(in(persona), std::string("com.example.only") + persona, 2).code,
              kDone);
  }
  using Listing = std::multimap<std::string, std::string>;
  const Listing atWork = {{"com.example.both", "W"}, {"com.example.onlyW", "W"}};
  const Listing atHome = {{"com.example.both", "P"}, {"com.example.onlyP", "P"}};
  const auto expectAll = [&] {
    const Listing all = listing(std::nullopt, 2);
    EXPECT_EQ(all.size(), 6U);
    std::vector<std::string> owners;
    for (auto [it, end] = all.equal_range("com.example.both"); it != end; ++it) {
      owners.push_back(it->second);
    }
    std::sort(owners.begin(), owners.end());
    EXPECT_EQ(owners, (std::vector<std::string>{"P", "S", "W"}));
    EXPECT_EQ(listing("W", 2), atWork);
    EXPECT_EQ(listing("P", 2), atHome);
    // What belongs to no user is listed once.
    EXPECT_EQ(listing(std::nullopt, 1).size(), 1U);
    EXPECT_EQ(listing(std::nullopt, 12).size(), 1U);
  };
  expectAll();
  ASSERT_EQ(device_->stop(), 0);
  device_->start();
  expectAll();
}

TEST_F(Personas, APersonaThatGoesTakesItsMappingsAndEntriesAlong) {
  device_->setPersonas(kAll);
  device_->start();
  const std::string work = device_->create(in("W"), "com.example.work", 2).text("path");
  const std::string gone = device_->create(in("W"), "com.example.both", 2).text("path");
  const std::string second = device_->create(in("S"), "com.example.second", 2).text("path");
  const std::string home = device_->create(in("P"), "com.example.other", 2).text("path");
  ASSERT_EQ(mapped(kWorkID, "com.example.work"), work);
  const uint64_t before = invalidations();
  tessary::Client worker = accepted(in("W"));
  ASSERT_TRUE(worker.createOrLookup("com.example.work", 2));

  device_->setPersonas({kPersonal, kOtherEnterprise, kUniversal});
  ASSERT_TRUE(listBecomes({"P", "S"}));
  EXPECT_TRUE(becomes([&] { return !mapped(kWorkID, "com.example.work"); }));
  EXPECT_TRUE(becomes([&] { return invalidations() == before + 2; })) << "once for each of the two";
  EXPECT_EQ(mapped(100, "com.example.other"), home);
  const auto refused = worker.createOrLookup("com.example.work", 2);
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code, kNoUserIdentity);
  // The other one has only been forgotten: what asks for it finds it again.
  EXPECT_EQ(device_->lookup(in("S"), "com.example.second", 2).text("path"), second);
  EXPECT_EQ(mapped(102, "com.example.second"), second);
  EXPECT_EQ(device_->lookup(in(std::nullopt), "com.example.work", 2).code, kNotFound)
      << "now it is an application like any other";

  // The disk has changed when the persona comes back.
  std::filesystem::remove_all(gone);
  const std::string moved = work.substr(0, work.rfind('/') + 1) + platform::UUID::random().string();
  std::filesystem::rename(work, moved);
  device_->setPersonas(kAll);
  ASSERT_TRUE(listBecomes({"P", "S", "W"}));
  const auto found = worker.createOrLookup("com.example.work", 2);
  ASSERT_TRUE(found) << found.error().code;
  EXPECT_EQ(found->path, moved);
  EXPECT_EQ(mapped(kWorkID, "com.example.work"), moved);
  EXPECT_EQ(device_->lookup(in("W"), "com.example.both", 2).code, kNotFound);
}

// Clients go on asking while the list changes under them: every request is answered, and none that
// comes at a bad moment makes the daemon forget a container, or make it twice.
TEST_F(Personas, ClientsAreServedWhileTheListChanges) {
  device_->setPersonas(kAll);
  device_->start();
  const std::vector<std::string> applications = {"com.example.both", "com.example.work"};
  std::map<std::string, std::string> paths;  // of the persona that comes and goes
  for (const std::string& application : applications) {
    paths[application] = device_->create(in("W"), application, 2).text("path");
  }
  const uint64_t before = invalidations();
  tessary::Client watcher = accepted(in(std::nullopt));
  std::vector<tessary::Client> clients;
  for (const auto& persona :
       std::vector<std::optional<std::string>>{"W", "S", "P", std::nullopt, "W", std::nullopt}) {
    clients.push_back(accepted(in(persona)));
  }
  std::atomic<bool> enough = false;
  std::atomic<unsigned> answered = 0;
  const auto ask = [&](tessary::Client& client, size_t number) {
    std::string wrong;
    const auto judge = [&](const auto& result) {
      ++answered;
      if (result) return;
      // A persona may go before the request or in the middle of it.
      const uint64_t code = result.error().code;
      const bool isFine = code == kNoUserIdentity || code == kRefused || code == kRebuildFailed ||
                          code == kAddFailed;
      if (!isFine) wrong += fmt::format("{} {}; ", result.error().text, code);
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
  std::vector<std::future<std::string>> threads;
  for (size_t i = 0; i < clients.size(); ++i) {
    threads.push_back(std::async(std::launch::async, ask, std::ref(clients[i]), i));
  }
  constexpr int kChanges = 40;
  std::atomic<bool> isServed = true;
  auto changing = std::async(std::launch::async, [&] {
    for (int change = 1; change <= kChanges && isServed; ++change) {
      const unsigned seen = answered;
      const bool without = change % 2 == 1;
      device_->setPersonas(without ? std::vector{kPersonal, kOtherEnterprise} : kAll);
      isServed = becomes([&] {
        const auto list = watcher.personaList();
        return list && list->size() == (without ? 2 : 3) && answered > seen + 20;
      });
    }
  });
  if (changing.wait_for(std::chrono::seconds(120)) != std::future_status::ready) isServed = false;
  enough = true;
  EXPECT_TRUE(isServed) << "no answers any more";
  if (!isServed) device_->kill();  // lets the threads end
  changing.wait();
  for (auto& thread : threads) EXPECT_EQ(thread.get(), "");
  ASSERT_TRUE(isServed);

  EXPECT_TRUE(becomes([&] { return invalidations() == before + kChanges / 2 * 3; }))
      << "both enterprise personas go, or the one that is there: " << invalidations() - before;
  const std::filesystem::path work =
      device_->path(kWork + std::string("/Containers/Data/Application"));
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(work), {}), 2) << "made twice";
  for (const auto& [application, path] : paths) {
    EXPECT_EQ(device_->lookup(in("W"), application, 2).text("path"), path);
  }
  for (const char* persona : {"W", "S", "P"}) {
    EXPECT_EQ(listing(persona, 2).count("com.example.both"), 1U) << persona;
  }
  EXPECT_EQ(mapped(kWorkID, "com.example.work"), paths["com.example.work"]);
  EXPECT_EQ(device_->stop(), 0);
}

TEST_F(Personas, TheLastGoodListStaysWhenTheFileBreaks) {
  device_->setPersonas(kAll);
  device_->start();
  const std::string path = device_->path("/etc/tessary/personas.plist");
  const auto complaints = [&] {
    const std::string log = device_->systemLog();
    size_t count = 0;
    for (size_t at = 0; (at = log.find("the last good list stays", at)) != std::string::npos; ++at)
      ++count;
    return count;
  };
  // Another list, for a link that must not be followed.
  const std::string good = device_->path("/etc/good.plist");
  device_->setPersonas({kPersonal, kUniversal});
  ASSERT_TRUE(listBecomes({"P"}));
  std::filesystem::copy_file(path, good);
  device_->setPersonas(kAll);
  ASSERT_TRUE(listBecomes({"P", "S", "W"}));
  const uint64_t invalidationsBefore = invalidations();
  const std::function<void()> breakages[] = {
      [&] { std::ofstream(path) << "nonsense"; },
      [&] { std::ofstream(path, std::ios::trunc).flush(); },
      [&] { device_->setPersonas({kPersonal, kPersonal}); },
      [&] { device_->setPersonas({kPersonal, {"W", kWorkID, "imaginary", kWork, {}}}); },
      [&] { device_->setPersonas({kPersonal, {"W", kWorkID, "enterprise", "/a/../../b", {}}}); },
      [&] { std::filesystem::remove(path); },
      [&] {
        std::filesystem::create_symlink(good, path + ".link");
        std::filesystem::rename(path + ".link", path);
      },
  };
  for (size_t i = 0; i < std::size(breakages); ++i) {
    const size_t before = complaints();
    breakages[i]();
    ASSERT_TRUE(becomes([&] { return complaints() > before; })) << i;
    EXPECT_EQ(personaList(std::nullopt), (std::vector<std::string>{"P", "S", "W"})) << i;
  }
  EXPECT_EQ(invalidations(), invalidationsBefore);
  std::filesystem::remove(path);
  device_->setPersonas({kPersonal});
  EXPECT_TRUE(listBecomes({"P"}));
}

TEST_F(Personas, WithoutTheListAtStartThereAreNone) {
  device_->start();
  device_->setPersonas(kAll);
  for (const auto& persona : std::vector<std::optional<std::string>>{std::nullopt, "W"}) {
    const Answer made = device_->create(in(persona), "com.example.work", 2);
    ASSERT_EQ(made.code, kDone) << made.errors;
    EXPECT_TRUE(made.text("path").starts_with(device_->path(kHome) + "/")) << made.text("path");
    EXPECT_EQ(made.text("persona"), "");
    EXPECT_EQ(personaList(persona), std::vector<std::string>{});
  }
}

}  // namespace
