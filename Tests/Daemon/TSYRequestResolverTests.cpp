#include <gtest/gtest.h>

#include "Daemon/TSYRequestResolvers.h"
#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::UUID;
using platform::Value;
using platform::ipc::Message;

TSYClientConnection clientOf(const std::string& persona) {
  TSYUserIdentityCache& users = TSYUserIdentitySharedCache::sharedInstance();
  if (persona == "none") return unentitledConnection(clientWith("com.client", nullptr));
  return unentitledConnection(clientWith(
      "com.client", persona == "unspecific"
                        ? users.unspecificUserIdentity()
                        : users.userIdentityForCurrentUserWithPersonaUniqueString(persona)));
}

// "personal", "unspecific" or the unique string of an enterprise persona; a code in decimal.
std::string nameOf(const TSYResolved<TSYUserIdentityRef>& resolved) {
  if (!resolved) return std::to_string(resolved.error());
  if ((*resolved)->isEnterprise()) return (*resolved)->identifier();
  return (*resolved)->isNoSpecificPersona() ? "unspecific" : "personal";
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
    const TSYClientConnection connection = clientOf(client);
    std::vector<std::string> results;
    for (const auto& persona : personas) {
      results.push_back(nameOf(TSYResolvePersona(connection, persona)));
    }
    EXPECT_EQ(results, expected) << client;
  }
}

TEST(TSYRequestResolvers, concreteContainerIdentitiesOfRequests) {
  const ContainerDevice device(workPersonas());
  const TSYClientConnection client = clientOf("unspecific");
  const UUID uuid = UUID::random();
  const Value::Dictionary whole{{"Identifier", "com.app"},
                                {"ContainerClass", 2U},
                                {"UUID", uuid},
                                {"PersonaUniqueString", "E2"}};
  // One key is other than that, or missing when it is null.
  const struct {
    const char* key;
    Value value;
    std::string result;
  } cases[] = {{"UUID", uuid, "com.app E2"},
               {"Identifier", nullptr, "18"},  // no fallback to the client's own
               {"ContainerClass", nullptr, "20"},
               {"UUID", nullptr, "11"},
               {"PersonaUniqueString", nullptr, "com.app 501"},
               {"PersonaUniqueString", "gone", "76"},
               {"ContainerClass", 12U, "com.app 501"}};  // a global class needs no persona
  for (const auto& [key, value, result] : cases) {
    Value::Dictionary request = whole;
    request[key] = value;
    if (value.isNull()) request.erase(key);
    const auto identity = TSYResolveConcreteContainerIdentity(Message(request), client, {});
    EXPECT_EQ(identity ? identity->identifier() + " " + identity->userIdentity()->identifier()
                       : std::to_string(identity.error()),
              result)
        << Value(request).description();
  }
}

}  // namespace
