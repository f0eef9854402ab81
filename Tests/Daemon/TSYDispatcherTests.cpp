#include "Daemon/TSYDispatcher.h"

#include <gtest/gtest.h>

#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::Value;

const std::string kPrefix = "com.veltra.private.Tessary.";

TEST(TSYCommandTable, theRows) {
  // Flags: repliesOnReturn, allowUnentitled, consultsLookup.
  const struct {
    uint64_t first, last;
    std::string entitlement;
    std::string flags;
  } expected[] = {{0, 0, "allowed", "111"},
                  {1, 1, "allowed", "101"},
                  {2, 3, "allowed", "100"},
                  {4, 4, "userManagedAssets", "000"},
                  {5, 10, "allowed", "100"},
                  {11, 11, "wipeContainer", "100"},
                  {12, 12, "deleteContainerContent", "100"},
                  {13, 13, "allowed", "111"},
                  {14, 14, "allowed", "101"},
                  {15, 17, "allowed", "111"},
                  {18, 20, "allowed", "100"},
                  {21, 21, "allowed", "000"},
                  {22, 22, "allowed", "100"},
                  {23, 23, "allowed", "101"},
                  {24, 24, "dataMigration", "100"},
                  {25, 25, "testability", "100"},
                  {26, 26, "stageSharedContent", "100"},
                  {27, 27, "allowed", "100"},
                  {28, 28, "userManagedAssets", "110"},
                  {29, 29, "userManagedAssets", "100"},
                  {30, 30, "allowed", "100"},
                  {31, 31, "testability", "100"},
                  {32, 32, "allowed", "111"}};
  uint64_t command = 0;
  for (const auto& rows : expected) {
    ASSERT_EQ(rows.first, command);
    for (; command <= rows.last; ++command) {
      const TSYCommandRow& row = TSYCommandTable().at(command);
      EXPECT_EQ(row.command, command);
      EXPECT_NE(row.handler, nullptr);
      EXPECT_EQ(row.entitlement, kPrefix + rows.entitlement) << command;
      EXPECT_EQ(
          fmt::format("{:d}{:d}{:d}", row.repliesOnReturn, row.allowUnentitled, row.consultsLookup),
          rows.flags)
          << command;
    }
  }
  EXPECT_EQ(command, TSYCommandTable().size());
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
  const struct {
    size_t command;
    std::string entitlements;  // "-" for no identity
    // "refused", or: entitled, other identifiers, unrestricted, lookup, wipe list.
    std::string rights;
  } cases[] = {
      {0, "a", "Eou"},      {0, "1", "Eou"},      {0, "al", "Eou"},    {0, "", ""},
      {0, "o", "o"},        {0, "l", "l"},        {0, "ol", "ol"},     {0, "L", ""},
      {0, "0", ""},         {0, "s", ""},         {0, "w", ""},        {0, "-", ""},
      {1, "a", "Eou"},      {1, "", "refused"},   {1, "o", "refused"}, {1, "l", "l"},
      {1, "e", ""},         {1, "L", "refused"},  {1, "-", "refused"}, {2, "a", "Eou"},
      {2, "1", "Eou"},      {2, "0", "refused"},  {2, "s", "refused"}, {2, "l", "refused"},
      {2, "o", "refused"},  {2, "-", "refused"},  {4, "m", "E"},       {4, "om", "Eo"},
      {4, "a", "Eou"},      {4, "M", "refused"},  {4, "l", "refused"}, {11, "a", "Eou"},
      {11, "aw", "Eouw"},   {11, "w", "Ew"},      {11, "ow", "Eow"},   {11, "W", "refused"},
      {11, "aW", "Eou"},    {11, "l", "refused"}, {11, "", "refused"}, {24, "d", "E"},
      {24, "a", "Eou"},     {25, "a", "refused"}, {25, "at", "Eo"},    {25, "t", "E"},
      {25, "-", "refused"}, {31, "a", "refused"}, {31, "at", "Eo"},    {28, "", ""},
      {28, "m", "E"},       {28, "l", ""},        {28, "a", "Eou"},    {28, "-", ""},
      {32, "l", "l"},       {32, "", ""},         {32, "a", "Eou"},    {32, "-", ""}};
  size_t refusedClients = 0;
  for (const auto& test : cases) {
    SCOPED_TRACE(fmt::format("{} {}", test.command, test.entitlements));
    const TSYUserIdentityRef user = TSYUserIdentityCache::defaultUserIdentity();
    const TSYClientIdentityRef client =
        test.entitlements == "-"
            ? nullptr
            : clientWith("com.client", user, entitlementsOf(test.entitlements));
    const auto queue = std::make_shared<TSYCommandQueue>();
    const auto connection = checkEntitlementsAndInitClientObject(TSYCommandTable()[test.command],
                                                                 client, /*pid=*/4711, queue);
    ASSERT_EQ(connection == nullptr, test.rights == "refused");
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
    EXPECT_EQ(rights, test.rights);
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
