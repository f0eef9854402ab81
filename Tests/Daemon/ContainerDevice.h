// What the tests share: a device with the real services, on a fresh directory that goes with the
// object, with the users "mobile" (501) and "alice" (502) and a daemon log that is open at every
// level. The persona service is a fake. With it come clients, container identities, property lists
// on its disk, and the sandbox's mappings as a launcher sees them.
//
// The device becomes the current platform; a test makes one and no more.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYDaemonQueues.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"
#include "Platform/os/SandboxLog.h"
#include "Platform/values/PropertyList.h"
#include "Tests/ScratchDirectory.h"

inline platform::PersonaAttributes makePersona(platform::PersonaKind kind, uint32_t personaID,
                                               std::optional<std::string> uniqueString,
                                               std::vector<std::string> bundleIdentifiers = {}) {
  platform::PersonaAttributes persona;
  persona.uniqueString = std::move(uniqueString);
  persona.personaID = personaID;
  persona.kind = kind;
  persona.bundleIdentifiers = std::move(bundleIdentifiers);
  return persona;
}

// A persona service whose list changes when the test says so. Any thread.
class FakePersonas : public platform::Personas {
 public:
  using List = std::vector<platform::PersonaAttributes>;

  // Without a list the device has no personas.
  explicit FakePersonas(std::optional<List> list)
      : present_(list.has_value()), list_(std::move(list).value_or(List())) {}

  bool present() const override { return present_; }
  List list() const override {
    const platform::MutexLock lock(lock_);
    return list_;
  }
  std::optional<std::string> observe(const std::string& /*serviceName*/,
                                     std::function<void()> /*listDidUpdate*/) override {
    return std::nullopt;
  }

  // Tells nobody.
  void setList(List list) {
    const platform::MutexLock lock(lock_);
    list_ = std::move(list);
  }

 private:
  const bool present_;
  mutable platform::Mutex lock_;
  List list_ GUARDED_BY(lock_);
};

// The personal persona, two enterprise ones and a shared one. The bundles belong to: com.work E1,
// com.corp E1 and E2, com.both everybody, any other the personal persona.
inline FakePersonas::List workPersonas() {
  using platform::PersonaKind;
  return {makePersona(PersonaKind::personal, 100, "P"),
          makePersona(PersonaKind::enterprise, 201, "E1", {"com.work", "com.corp"}),
          makePersona(PersonaKind::enterprise, 202, "E2", {"com.corp"}),
          makePersona(PersonaKind::universal, 300, "U", {"com.both"})};
}

class ContainerDevice {
 public:
  // Without a list there are no personas. `files` are written before the services start: paths
  // below the root and their contents.
  explicit ContainerDevice(std::optional<FakePersonas::List> list = std::nullopt,
                           const std::map<std::string, std::string>& files = {},
                           int logLevel = TSYLogLevelDebug)
      : personas_(list) {
    ::umask(0);
    write("/etc/passwd",
          "root:x:0:0::/private/var/root:/bin/sh\n"
          "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
          "alice:x:502:502::/private/var/alice:/bin/sh\n");
    write("/etc/group", "systemusers:x:701:\n");
    for (const auto& [path, content] : files) write(path, content);
    makeHome("/private/var/root", 0);
    makeHome("/private/var/mobile", 501);
    makeHome("/private/var/alice", 502);
    device_ = std::move(platform::DevicePlatform::open(root_).value());
    const platform::Platform& real = device_->platform();
    current_.reset(new platform::Platform{
        real.files, real.accounts, real.containerLayout, real.device, real.keepAlive, real.keyBag,
        real.semaphores, real.notifications, personas_, real.runLoop, real.sandbox,
        real.serviceManager, real.systemLog, real.systemVersion, real.tasks});
    platform::Platform::setCurrent(*current_);
    if (!TSYLogOpen(path("/daemon.log"), logLevel, {.files = 1, .bytesPerFile = 1 << 24})) {
      throw std::runtime_error("no log");
    }
    if (list) giveHomes(std::move(*list));
  }
  ~ContainerDevice() {
    TSYDeathRowQueue().sync([] {});
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
  }
  ContainerDevice(const ContainerDevice&) = delete;
  ContainerDevice& operator=(const ContainerDevice&) = delete;

  FakePersonas& personas() { return personas_; }
  // A path of the device as the outside sees it.
  std::string path(const std::string& devicePath) const { return root_ + devicePath; }
  void write(const std::string& devicePath, const std::string& content) const {
    const std::filesystem::path file = path(devicePath);
    std::filesystem::create_directories(file.parent_path());
    std::ofstream(file) << content;
  }
  std::string read(const std::string& devicePath) const {
    std::ostringstream content;
    content << std::ifstream(path(devicePath)).rdbuf();
    return content.str();
  }
  std::string log() const { return read("/daemon.log"); }
  size_t countInLog(const std::string& text) const {
    const std::string all = log();
    size_t count = 0;
    for (size_t at = all.find(text); at != std::string::npos; at = all.find(text, at + 1)) ++count;
    return count;
  }

  void writePropertyList(const std::string& devicePath, const platform::Value& value) const {
    const auto bytes = platform::writeBinaryPropertyList(value);
    ASSERT_TRUE(bytes.has_value()) << bytes.error().reason;
    write(devicePath, std::string(bytes->begin(), bytes->end()));
  }

  // "uid/persona/item type/identifier" to the path without the root.
  std::map<std::string, std::string> mappings() const {
    std::map<std::string, std::string> current;
    std::istringstream lines(read("/run/tessary/sandbox/mappings"));
    for (std::string line; std::getline(lines, line);) {
      const auto mapping = platform::parseMappingLine(line);
      EXPECT_TRUE(mapping.has_value()) << line;
      if (!mapping) continue;
      const std::string key = fmt::format("{}/{}/{}/{}", mapping->uid, mapping->personaID,
                                          mapping->itemType, mapping->identifier);
      if (mapping->path) {
        current[key] = mapping->path->substr(path("").size());
      } else {
        current.erase(key);
      }
    }
    return current;
  }

  // The names in a directory, sorted; a directory that is not there is empty.
  std::vector<std::string> namesIn(const std::string& devicePath) const {
    std::vector<std::string> names;
    std::error_code missing;
    for (const auto& entry : std::filesystem::directory_iterator(path(devicePath), missing)) {
      names.push_back(entry.path().filename());
    }
    std::sort(names.begin(), names.end());
    return names;
  }

 private:
  void makeHome(const std::string& devicePath, uid_t owner) const {
    std::filesystem::create_directories(path(devicePath));
    // Without root's rights everything belongs to the tester, which is as good.
    if (::geteuid() == 0 && ::chown(path(devicePath).c_str(), owner, owner) != 0) {
      throw std::runtime_error("no home");
    }
  }
  // Each enterprise persona has a home of its own, as its name says.
  void giveHomes(FakePersonas::List list) {
    for (platform::PersonaAttributes& persona : list) {
      if (persona.kind != platform::PersonaKind::enterprise || !persona.uniqueString) continue;
      persona.layoutPath = path("/private/var/" + *persona.uniqueString);
      std::filesystem::create_directories(*persona.layoutPath);
    }
    personas_.setList(std::move(list));
  }

  const std::string root_ = makeScratchDirectory(testing::TempDir());
  FakePersonas personas_;
  std::unique_ptr<platform::DevicePlatform> device_;
  std::unique_ptr<platform::Platform> current_;
};

inline TSYContainerIdentity containerOf(const TSYUserIdentityRef& user,
                                        const std::string& identifier,
                                        TSYContainerClass containerClass) {
  return *TSYContainerIdentity::containerIdentityWithUserIdentity(user, identifier, containerClass);
}

inline TSYConcreteContainerIdentity concreteContainerOf(
    const TSYUserIdentityRef& user, const std::string& identifier, TSYContainerClass containerClass,
    const platform::UUID& uuid = platform::UUID::random()) {
  return *TSYConcreteContainerIdentity::containerIdentityWithUUID(uuid, user, identifier,
                                                                  containerClass);
}

inline TSYClientIdentityRef clientWith(std::string bundleIdentifier, TSYUserIdentityRef user,
                                       platform::Value::Dictionary entitlements = {}) {
  return std::make_shared<const TSYClientIdentity>(
      std::move(bundleIdentifier), 501, 501, ::getpid(), std::move(user),
      std::make_shared<const platform::Value::Dictionary>(std::move(entitlements)),
      /*sandboxed=*/false, platform::AuditToken::make(501, 501, ::getpid(), /*startTime=*/7));
}

// A client who has no right but his own identity.
inline TSYClientConnection unentitledConnection(TSYClientIdentityRef client) {
  return {std::move(client),
          /*entitled=*/false,
          /*allowOtherIdLookup=*/false,
          /*unrestricted=*/false,
          std::nullopt,
          std::nullopt,
          std::make_shared<TSYCommandQueue>()};
}

// `text` is a part of the error's description.
template <typename T>
void expectFailure(const TSYResult<T>& result, uint64_t code, const std::string& text) {
  ASSERT_FALSE(result.has_value()) << "expected " << code << ": " << text;
  EXPECT_EQ(result.error().domain(), TSYErrorDomain);
  EXPECT_EQ(result.error().code(), code) << result.error().description();
  EXPECT_NE(result.error().localizedDescription().value_or("").find(text), std::string::npos)
      << *result.error().localizedDescription() << "\nlacks " << text;
}

// A command that does what a test wants.
class Step : public TSYCommand {
 public:
  using Work = std::function<TSYResult<void>(TSYCommandQueue&)>;

  explicit Step(Work work) : work_(std::move(work)) {}
  uint64_t command() const override { return 99; }
  TSYResult<void> fromQueueExecute(TSYCommandQueue& queue) override { return work_(queue); }

 private:
  const Work work_;
};

// What a process that stops says last. With a journal on the machine it is said there.
inline std::string lastWords(const std::string& pattern) {
  return ::access("/run/systemd/journal/socket", W_OK) == 0 ? "" : pattern;
}
