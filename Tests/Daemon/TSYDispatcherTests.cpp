#include "Daemon/TSYDispatcher.h"

#include <gtest/gtest.h>

#include <array>
#include <set>

#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::Value;

const std::string kPrefix = "com.veltra.private.Tessary.";

TEST(TSYCommandTable, theRows) {
  // Rows that are not named here are "allowed" and only reply on return.
  const std::map<uint64_t, std::string> entitlements = {
      {4, "userManagedAssets"},  {11, "wipeContainer"},     {12, "deleteContainerContent"},
      {24, "dataMigration"},     {25, "testability"},       {26, "stageSharedContent"},
      {28, "userManagedAssets"}, {29, "userManagedAssets"}, {31, "testability"}};
  const std::set<uint64_t> deferred = {4, 21};
  const std::set<uint64_t> unentitled = {0, 13, 15, 16, 17, 28, 32};
  const std::set<uint64_t> lookup = {0, 1, 13, 14, 15, 16, 17, 23, 32};
  ASSERT_EQ(TSYCommandTable().size(), 33U);
  for (uint64_t command = 0; command < 33; ++command) {
    const TSYCommandRow& row = TSYCommandTable()[command];
    const auto entitlement = entitlements.find(command);
    EXPECT_EQ(row.command, command);
    EXPECT_NE(row.handler, nullptr);
    EXPECT_EQ(row.entitlement,
              kPrefix + (entitlement == entitlements.end() ? "allowed" : entitlement->second));
    EXPECT_EQ(row.repliesOnReturn, !deferred.contains(command)) << command;
    EXPECT_EQ(row.allowUnentitled, unentitled.contains(command)) << command;
    EXPECT_EQ(row.consultsLookup, lookup.contains(command)) << command;
  }
}

// Each letter stands for one entitlement.
Value::Dictionary entitlementsOf(const std::string& letters) {
  const Value listed = Value::Dictionary{{"appData", Value::Array{"com.listed"}}};
  const std::map<char, std::pair<std::string, Value>> meanings = {
      {'a', {"allowed", true}},
      {'1', {"allowed", 1}},
      {'0', {"allowed", false}},
      {'s', {"allowed", "true"}},
      {'o', {"otherIdLookup", true}},
      {'l', {"lookup", listed}},
      {'e', {"lookup", Value::Dictionary{}}},
      {'L', {"lookup", Value::Array{listed}}},
      {'w', {"wipeContainer", Value::Array{"com.wiped"}}},
      {'W', {"wipeContainer", true}},
      {'t', {"testability", true}},
      {'d', {"dataMigration", true}},
      {'m', {"userManagedAssets", true}},
      {'M', {"userManagedAssets", Value::Array{}}}};
  Value::Dictionary entitlements;
  for (const char letter : letters) {
    const auto& [name, value] = meanings.at(letter);
    entitlements.emplace(kPrefix + name, value);
  }
  return entitlements;
}

TEST(TSYDispatcher, whatEntitlementsComeTo) {
  const ContainerDevice device;
  // "entitlements=rights" for each client, "-" without an identity. Rights: entitled, other
  // identifiers, unrestricted, lookup, wipe list; "x" when the client is refused.
  const std::pair<size_t, std::string> cases[] = {
      {0, "a=Eou 1=Eou al=Eou = o=o l=l ol=ol L= 0= s= w= -="},
      {1, "a=Eou =x o=x l=l e= L=x -=x"},
      {2, "a=Eou 1=Eou 0=x s=x l=x o=x -=x"},
      {4, "m=E om=Eo a=Eou M=x l=x"},
      {11, "a=Eou aw=Eouw w=Ew ow=Eow W=x aW=Eou l=x =x"},
      {24, "d=E a=Eou"},
      {25, "a=x at=Eo t=E -=x"},
      {28, "= m=E l= a=Eou -="},
      {31, "a=x at=Eo"},
      {32, "l=l = a=Eou -="}};
  size_t refusedClients = 0;
  std::vector<std::array<std::string, 3>> requests;
  for (const auto& [command, clients] : cases) {
    std::istringstream list(clients);
    for (std::string client; list >> client;) {
      const size_t equals = client.find('=');
      requests.push_back(
          {std::to_string(command), client.substr(0, equals), client.substr(equals + 1)});
    }
  }
  for (const auto& [command, entitlements, expected] : requests) {
    SCOPED_TRACE(command + " " + entitlements);
    const TSYUserIdentityRef user = TSYUserIdentityCache::defaultUserIdentity();
    const TSYClientIdentityRef client =
        entitlements == "-" ? nullptr
                            : clientWith("com.client", user, entitlementsOf(entitlements));
    const auto queue = std::make_shared<TSYCommandQueue>();
    const auto connection = checkEntitlementsAndInitClientObject(
        TSYCommandTable().at(std::stoul(command)), client, /*pid=*/4711, queue);
    ASSERT_EQ(connection == nullptr, expected == "x");
    if (!connection) {
      if (client) ++refusedClients;
      continue;
    }
    std::string rights;
    if (connection->entitled()) rights += 'E';
    if (connection->allowOtherIdLookup()) rights += 'o';
    if (connection->unrestricted()) rights += 'u';
    if (connection->isEntitledForLookupWithClass(2, "com.listed")) rights += 'l';
    if (connection->entitledWipeIdentifiers()) rights += 'w';
    EXPECT_EQ(rights, expected);
    EXPECT_EQ(connection->clientIdentity(), client);
    EXPECT_EQ(&connection->commandQueue(), queue.get());
    EXPECT_FALSE(connection->allowGroupIdLookup());
  }
  EXPECT_EQ(device.countInLog("connection attempt from pid 4711 (com.client) is not entitled"),
            refusedClients);
  EXPECT_EQ(device.countInLog("connection attempt from pid 4711 ((null)) is not entitled"), 3U);
  EXPECT_EQ(device.countInLog("No entitled containers to wipe"), 5U);
}

}  // namespace
