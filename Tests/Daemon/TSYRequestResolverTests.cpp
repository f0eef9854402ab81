#include <gtest/gtest.h>

#include "Daemon/TSYRequestResolvers.h"
#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::UUID;
using platform::Value;
using platform::ipc::Message;

TSYUserIdentityCache& users() {
  return TSYUserIdentitySharedCache::sharedInstance();
}

TSYUserIdentityRef user(const std::string& name) {
  if (name == "none") return nullptr;
  return name == "unspecific" ? users().unspecificUserIdentity()
                              : users().userIdentityForCurrentUserWithPersonaUniqueString(name);
}

// "personal", "unspecific" or the unique string of an enterprise persona; a code in decimal.
std::string nameOf(const TSYResolved<TSYUserIdentityRef>& resolved) {
  if (!resolved) return std::to_string(resolved.error());
  if ((*resolved)->isEnterprise()) return (*resolved)->identifier();
  return (*resolved)->isNoSpecificPersona() ? "unspecific" : "personal";
}

TEST(TSYRequestResolvers, theClientsOwnIdentifierStandsIn) {
  const ContainerDevice device;
  const TSYClientConnection client =
      unentitledConnection(clientWith("com.client", users().userIdentityForPersonalPersona()));
  const TSYClientConnection nobody = unentitledConnection(nullptr);
  const Message with(Value::Dictionary{{"Identifier", "com.named"}});
  const Message without(Value::Dictionary{{"Identifier", 7}});
  constexpr auto kFallback = TSYIdentifierFallback::client;
  EXPECT_EQ(TSYResolveIdentifier(with, client, kFallback), "com.named");
  EXPECT_EQ(TSYResolveIdentifier(without, client, kFallback), "com.client");
  EXPECT_EQ(TSYResolveIdentifier(without, client, TSYIdentifierFallback::none), std::nullopt);
  EXPECT_EQ(TSYResolveIdentifier(without, nobody, kFallback), std::nullopt);
  const Message empty(Value::Dictionary{{"Identifier", ""}});
  EXPECT_EQ(TSYResolveIdentifier(empty, client, kFallback), "");
}

TEST(TSYRequestResolvers, whoseContainerAnIdentifierMeans) {
  const ContainerDevice device(workPersonas());
  const std::vector<std::string> identifiers = {"com.nobody", "com.work", "com.both", "com.corp"};
  const struct {
    std::string client;
    std::vector<std::string> ofUserClass;  // for each of the identifiers
    std::string ofGlobalClass;
  } cases[] = {{"unspecific", {"personal", "E1", "unspecific", "unspecific"}, "unspecific"},
               {"P", {"personal", "personal", "personal", "personal"}, "personal"},
               {"E2", {"E2", "E2", "E2", "E2"}, "E2"},
               {"none", {"76", "76", "76", "76"}, "76"}};
  for (const auto& test : cases) {
    const TSYClientConnection connection =
        unentitledConnection(clientWith("com.client", user(test.client)));
    for (TSYContainerClass class_ = 1; class_ < kTSYContainerClassMax; ++class_) {
      for (size_t i = 0; i < identifiers.size(); ++i) {
        EXPECT_EQ(nameOf(TSYResolveUserIdentityForIdentifier(connection, identifiers[i], class_)),
                  TSYIsPerUserClass(class_) ? test.ofUserClass[i] : test.ofGlobalClass)
            << test.client << " " << identifiers[i] << " " << class_;
      }
    }
  }
  const TSYClientConnection nobody = unentitledConnection(nullptr);
  EXPECT_EQ(nameOf(TSYResolveUserIdentityForIdentifier(nobody, "com.work", 2)), "76");
}

TEST(TSYRequestResolvers, containerIdentitiesOfRequests) {
  const ContainerDevice device(workPersonas());
  const TSYClientConnection client =
      unentitledConnection(clientWith("com.client", user("unspecific")));
  const TSYClientConnection nobody = unentitledConnection(nullptr);
  const Value id = "com.work";
  const struct {
    const TSYClientConnection& client;
    Value::Dictionary request;
    TSYIdentifierFallback fallback;
    uint64_t code;
    std::string identifier;
    std::string owner;
  } cases[] = {
      {client, {{"Identifier", id}, {"ContainerClass", 2U}}, {}, 1, "com.work", "E1"},
      {client, {{"ContainerClass", 2U}}, TSYIdentifierFallback::client, 1, "com.client", "501"},
      {client, {{"ContainerClass", 14U}}, TSYIdentifierFallback::none, 18, "", ""},
      {client, {{"Identifier", id}}, {}, 20, "", ""},
      {client, {{"Identifier", id}, {"ContainerClass", 14U}}, {}, 20, "", ""},
      {client, {{"Identifier", id}, {"ContainerClass", -1}}, {}, 20, "", ""},
      {client, {{"Identifier", id}, {"ContainerClass", UINT64_MAX}}, {}, 20, "", ""},
      {nobody, {{"Identifier", id}, {"ContainerClass", 2U}}, {}, 76, "", ""},
      {nobody, {{"ContainerClass", 2U}}, TSYIdentifierFallback::client, 18, "", ""}};
  for (const auto& test : cases) {
    const auto identity =
        TSYResolveContainerIdentity(Message(test.request), test.client, test.fallback);
    EXPECT_EQ(identity ? TSYErrorSuccess : identity.error(), test.code)
        << Value(test.request).description();
    if (!identity) continue;
    EXPECT_EQ(identity->identifier(), test.identifier);
    EXPECT_EQ(identity->userIdentity()->identifier(), test.owner);
  }
}

TEST(TSYRequestResolvers, personasOfRequests) {
  const ContainerDevice device(workPersonas());
  const std::optional<std::string> personas[] = {"P", "E1", "E2", "U", "gone", "", std::nullopt};
  const std::pair<std::string, std::vector<std::string>> cases[] = {
      {"unspecific", {"personal", "E1", "E2", "unspecific", "76", "76", "unspecific"}},
      {"P", {"personal", "76", "76", "unspecific", "76", "76", "unspecific"}},
      {"E1", {"76", "E1", "76", "76", "76", "76", "76"}},
      {"none", {"76", "76", "76", "76", "76", "76", "76"}}};
  for (const auto& [client, expected] : cases) {
    const TSYClientConnection connection =
        unentitledConnection(clientWith("com.client", user(client)));
    std::vector<std::string> results;
    for (const auto& persona : personas) {
      results.push_back(nameOf(TSYResolvePersona(connection, persona)));
    }
    EXPECT_EQ(results, expected) << client;
  }
  EXPECT_EQ(device.countInLog("Cannot reconstitute a user identity from provided persona"), 6U);
  EXPECT_EQ(device.countInLog("Persona unique string is not valid for this client"), 6U);
}

TEST(TSYRequestResolvers, withSeveralUsersThePersonaStringIsIgnored) {
  const ContainerDevice device(
      std::nullopt, {{"/etc/tessary/device.plist",
                      "<plist><dict><key>MultiUserFlags</key><integer>2147483648</integer>"
                      "</dict></plist>"}});
  const TSYUserIdentityRef alice = users().userIdentityForPersonalPersonaWithUID(502, 502);
  const TSYClientConnection client = unentitledConnection(clientWith("com.client", alice));
  const auto persona = TSYResolvePersona(client, "E1");
  ASSERT_TRUE(persona.has_value());
  EXPECT_EQ(*persona, alice);
}

TEST(TSYRequestResolvers, concreteContainerIdentitiesOfRequests) {
  const ContainerDevice device(workPersonas());
  const TSYClientConnection client =
      unentitledConnection(clientWith("com.client", user("unspecific")));
  const UUID uuid = UUID::random();
  const auto resolve = [&](Value::Dictionary request, const TSYConcreteKeys& keys = {}) {
    const auto identity =
        TSYResolveConcreteContainerIdentity(Message(std::move(request)), client, keys);
    if (!identity) return std::to_string(identity.error());
    EXPECT_EQ(identity->uuid(), uuid);
    return identity->identifier() + " " + identity->userIdentity()->identifier();
  };
  Value::Dictionary request{{"Identifier", "com.app"},
                            {"ContainerClass", 2U},
                            {"UUID", uuid},
                            {"PersonaUniqueString", "E2"}};
  EXPECT_EQ(resolve(request), "com.app E2");
  EXPECT_EQ(resolve(request, {.identifier = "Old"}), "18") << "no fallback to the client's own";
  const auto without = [&](const char* key) {
    Value::Dictionary less = request;
    less.erase(key);
    return resolve(less);
  };
  EXPECT_EQ(without("Identifier"), "18");
  EXPECT_EQ(without("ContainerClass"), "20");
  EXPECT_EQ(without("UUID"), "11");
  EXPECT_EQ(without("PersonaUniqueString"), "com.app 501");
  request["PersonaUniqueString"] = "gone";
  EXPECT_EQ(resolve(request), "76");
  request["ContainerClass"] = 12U;
  EXPECT_EQ(resolve(request), "com.app 501") << "a global class needs no persona";
}

TEST(TSYRequestResolvers, tokensAreForSandboxedClientsOfEnterpriseContainers) {
  const ContainerDevice device(workPersonas());
  const std::string container = "com.veltra.sandbox.container";
  const std::map<TSYContainerClass, std::string> extensions = {
      {2, container},
      {4, container},
      {6, container},
      {10, container},
      {7, "com.veltra.sandbox.application-group"}};
  const platform::Sandbox& sandbox = platform::Platform::current().sandbox;
  std::filesystem::create_directories(device.path("/container"));
  for (const char* owner : {"E1", "P", "unspecific"}) {
    for (TSYContainerClass class_ = 1; class_ < kTSYContainerClassMax; ++class_) {
      const TSYMetadata metadata(concreteContainerOf(user(owner), "com.app", class_), nullptr,
                                 TSYURL(device.path("/container")), std::nullopt);
      const auto free = clientWith("com.client", user("P"));
      EXPECT_FALSE(TSYIssueSandboxExtension(metadata, *free).has_value());
      const auto client = clientWith("com.client", user("P"), {}, /*sandboxed=*/true);
      const auto token = TSYIssueSandboxExtension(metadata, *client);
      const auto extension = extensions.find(class_);
      ASSERT_EQ(token.has_value(), owner == std::string("E1") && extension != extensions.end())
          << owner << class_;
      if (!token) continue;
      EXPECT_TRUE(token->starts_with(extension->second + ";")) << *token;
      EXPECT_NE(token->find(";" + device.path("/container") + ";"), std::string::npos);
      EXPECT_TRUE(sandbox.verifyExtension(*token, client->auditToken()));
      EXPECT_FALSE(sandbox.verifyExtension(*token, platform::AuditToken{}));
    }
  }
}

}  // namespace
