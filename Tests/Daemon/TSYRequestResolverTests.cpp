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
  const Message with({{"Identifier", "com.named"}});
  const Message without({{"Identifier", 7}});
  constexpr auto kFallback = TSYIdentifierFallback::client;
  EXPECT_EQ(TSYResolveIdentifier(with, client, kFallback), "com.named");
  EXPECT_EQ(TSYResolveIdentifier(without, client, kFallback), "com.client");
  EXPECT_EQ(TSYResolveIdentifier(without, client, TSYIdentifierFallback::none), std::nullopt);
  EXPECT_EQ(TSYResolveIdentifier(without, nobody, kFallback), std::nullopt);
  EXPECT_EQ(TSYResolveIdentifier(Message({{"Identifier", ""}}), client, kFallback), "");
}

TEST(TSYRequestResolvers, whoseContainerAnIdentifierMeans) {
  const ContainerDevice device(workPersonas());
  const struct {
    std::string client;
    std::string identifier;
    TSYContainerClass class_;
    std::string result;
    std::string logged;
  } cases[] = {{"unspecific", "com.nobody", 2, "personal", ""},
               {"unspecific", "com.work", 2, "E1", ""},
               {"unspecific", "com.work", 11, "E1", ""},
               {"unspecific", "com.work", 6, "E1", ""},
               {"unspecific", "com.both", 2, "unspecific", ""},
               {"unspecific", "com.corp", 2, "unspecific", ""},
               {"unspecific", "com.work", 1, "unspecific", ""},
               {"unspecific", "com.work", 12, "unspecific", ""},
               {"P", "com.work", 2, "personal", ""},
               {"E2", "com.work", 2, "E2", ""},
               {"none", "com.work", 2, "76", ""},
               {"none", "com.work", 1, "76", ""}};
  for (const auto& test : cases) {
    const TSYClientConnection connection =
        unentitledConnection(clientWith("com.client", user(test.client)));
    EXPECT_EQ(nameOf(TSYResolveUserIdentityForIdentifier(connection, test.identifier, test.class_)),
              test.result)
        << test.client << " " << test.identifier << " " << test.class_;
  }
  EXPECT_EQ(device.countInLog("Chose bundleIdentifier: com.corp, userIdentities: {("), 1U);
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
  const struct {
    std::string client;
    std::optional<std::string> persona;
    std::string result;
  } cases[] = {{"unspecific", "P", "personal"},
               {"unspecific", "E1", "E1"},
               {"unspecific", "U", "unspecific"},
               {"unspecific", std::nullopt, "unspecific"},
               {"unspecific", "gone", "76"},
               {"unspecific", "", "76"},
               {"P", "P", "personal"},
               {"P", "E1", "76"},
               {"E1", "E1", "E1"},
               {"E1", "E2", "76"},
               {"E1", "P", "76"},
               {"E1", std::nullopt, "76"},
               {"none", "P", "76"}};
  for (const auto& test : cases) {
    const TSYClientConnection connection =
        unentitledConnection(clientWith("com.client", user(test.client)));
    EXPECT_EQ(nameOf(TSYResolvePersona(connection, test.persona)), test.result)
        << test.client << " " << test.persona.value_or("(null)");
  }
  EXPECT_EQ(device.countInLog("Cannot reconstitute a user identity from provided persona"), 2U);
  EXPECT_EQ(device.countInLog("Persona unique string is not valid for this client"), 4U);
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
  const struct {
    bool sandboxed;
    std::string owner;
    TSYContainerClass class_;
    std::string extensionClass;  // empty for no token
  } cases[] = {{true, "E1", 2, "com.veltra.sandbox.container"},
               {true, "E1", 4, "com.veltra.sandbox.container"},
               {true, "E1", 6, "com.veltra.sandbox.container"},
               {true, "E1", 10, "com.veltra.sandbox.container"},
               {true, "E1", 7, "com.veltra.sandbox.application-group"},
               {true, "E1", 9, ""},
               {true, "E1", 11, ""},
               {true, "E1", 12, ""},
               {true, "E1", 1, ""},
               {true, "P", 2, ""},
               {true, "unspecific", 7, ""},
               {false, "E1", 2, ""}};
  std::filesystem::create_directories(device.path("/container"));
  for (const auto& test : cases) {
    const TSYMetadata container(concreteContainerOf(user(test.owner), "com.app", test.class_),
                                nullptr, TSYURL(device.path("/container")), std::nullopt);
    const TSYClientIdentityRef client = clientWith("com.client", user("P"), {}, test.sandboxed);
    const auto token = TSYIssueSandboxExtension(container, *client);
    EXPECT_EQ(token.has_value(), !test.extensionClass.empty()) << test.owner << test.class_;
    if (!token) continue;
    EXPECT_TRUE(token->starts_with(test.extensionClass + ";")) << *token;
    EXPECT_NE(token->find(";" + device.path("/container") + ";"), std::string::npos);
    const platform::Sandbox& sandbox = platform::Platform::current().sandbox;
    EXPECT_TRUE(sandbox.verifyExtension(*token, client->auditToken()));
    EXPECT_FALSE(sandbox.verifyExtension(*token, platform::AuditToken{}));
  }
}

}  // namespace
