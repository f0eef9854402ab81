// What the tests of containers share: a device whose daemon log is open at every level, property
// lists on its disk, clients, and the sandbox's mappings as a launcher sees them.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <sstream>

#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYDaemonQueues.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/SandboxLog.h"
#include "Platform/values/PropertyList.h"
#include "Tests/Daemon/TestPlatform.h"

// The personal persona, two enterprise ones and a shared one. The bundles belong to: com.work E1,
// com.corp E1 and E2, com.both everybody, any other the personal persona.
inline FakePersonas::List workPersonas() {
  using platform::PersonaKind;
  return {makePersona(PersonaKind::personal, 100, "P"),
          makePersona(PersonaKind::enterprise, 201, "E1", {"com.work", "com.corp"}),
          makePersona(PersonaKind::enterprise, 202, "E2", {"com.corp"}),
          makePersona(PersonaKind::universal, 300, "U", {"com.both"})};
}

class ContainerDevice : public TestPlatform {
 public:
  explicit ContainerDevice(std::optional<FakePersonas::List> list = std::nullopt,
                           const std::map<std::string, std::string>& files = {})
      : TestPlatform(list, files) {
    ::umask(0);
    if (!TSYLogOpen(path("/daemon.log"), TSYLogLevelDebug, {.files = 1, .bytesPerFile = 1 << 24})) {
      throw std::runtime_error("no log");
    }
    if (!list) return;
    for (platform::PersonaAttributes& persona : *list) {
      if (persona.kind != platform::PersonaKind::enterprise) continue;
      persona.layoutPath = path("/private/var/" + *persona.uniqueString);
      std::filesystem::create_directories(*persona.layoutPath);
    }
    personas().setList(std::move(*list));
  }
  ~ContainerDevice() { waitForDeathRow(); }

  static void waitForDeathRow() {
    TSYDeathRowQueue().sync([] {});
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
                                       platform::Value::Dictionary entitlements = {},
                                       bool sandboxed = false) {
  return std::make_shared<const TSYClientIdentity>(
      std::move(bundleIdentifier), 501, 501, ::getpid(), std::move(user),
      std::make_shared<const platform::Value::Dictionary>(std::move(entitlements)), sandboxed,
      platform::AuditToken::make(501, 501, ::getpid(), /*startTime=*/7));
}

// A client who has no right but his own identity.
inline TSYClientConnection unentitledConnection(TSYClientIdentityRef client,
                                                TSYClientConnection::Lookup lookup = std::nullopt) {
  return {std::move(client),
          /*entitled=*/false,
          /*allowOtherIdLookup=*/false,
          /*unrestricted=*/false,
          std::move(lookup),
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

// What a process that stops says last. With a journal on the machine it is said there.
inline std::string lastWords(const std::string& pattern) {
  return ::access("/run/systemd/journal/socket", W_OK) == 0 ? "" : pattern;
}
