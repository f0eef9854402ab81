// The dispatcher, with its inner steps: no row of the table defers anything yet, and the order in
// which handler and deferred commands have their say is seen from outside only when one does.
#include "Daemon/TSYDispatcher.cpp"  // NOLINT(bugprone-suspicious-include)

#include <gtest/gtest.h>

#include "Tests/Daemon/ContainerDevice.h"

namespace {

const std::string kPrefix = "com.veltra.private.Tessary.";

// Each letter stands for one entitlement.
Value::Dictionary entitlementsOf(const std::string& letters) {
  const Value listed = Value::Dictionary{{"appData", Value::Array{"com.listed"}}};
  const std::map<char, std::pair<std::string, Value>> meanings = {
      {'a', {"allowed", true}},          {'o', {"otherIdLookup", true}},
      {'l', {"lookup", listed}},         {'w', {"wipeContainer", Value::Array{"com.wiped"}}},
      {'W', {"wipeContainer", true}},    {'t', {"testability", true}},
      {'m', {"userManagedAssets", true}}};
  Value::Dictionary entitlements;
  for (const char letter : letters) {
    const auto& [name, value] = meanings.at(letter);
    entitlements.emplace(kPrefix + name, value);
  }
  return entitlements;
}

TEST(TSYDispatcher, whatEntitlementsComeTo) {
  const ContainerDevice device;
  const TSYUserIdentityRef user = TSYUserIdentityCache::defaultUserIdentity();
  // "entitlements=rights" for each client, "-" without an identity. Rights: entitled, other
  // identifiers, unrestricted, lookup, wipe list; "x" when the client is refused.
  const std::pair<uint64_t, std::string> cases[] = {{0, "a=Eou al=Eou = o=o l=l ol=ol w= -="},
                                                    {2, "a=Eou l=x o=x -=x"},
                                                    {4, "m=E om=Eo a=Eou"},
                                                    {11, "a=Eou aw=Eouw w=Ew ow=Eow W=x aW=Eou"},
                                                    {25, "a=x at=Eo t=E -=x"}};
  for (const auto& [command, clients] : cases) {
    std::istringstream list(clients);
    for (std::string one; list >> one;) {
      SCOPED_TRACE(fmt::format("{}: {}", command, one));
      const std::string letters = one.substr(0, one.find('='));
      const TSYClientIdentityRef client =
          letters == "-" ? nullptr : clientWith("com.client", user, entitlementsOf(letters));
      const auto connection = checkEntitlementsAndInitClientObject(
          TSYCommandTable().at(command), client, /*pid=*/4711, std::make_shared<TSYCommandQueue>());
      std::string rights;
      if (!connection) {
        rights = 'x';
      } else {
        if (connection->entitled()) rights += 'E';
        if (connection->allowOtherIdLookup()) rights += 'o';
        if (connection->unrestricted()) rights += 'u';
        if (connection->isEntitledForLookupWithClass(2, "com.listed")) rights += 'l';
        if (connection->entitledWipeIdentifiers()) rights += 'w';
      }
      EXPECT_EQ(letters + "=" + rights, one);
    }
  }
  EXPECT_EQ(device.countInLog("connection attempt from pid 4711 ((null)) is not entitled"), 2U);
}

// Defers a command that returns `deferred` and itself returns `returned`; 0 stands for an
// exception.
template <uint64_t returned, uint64_t deferred>
uint64_t handler(TSYRelayEvent& /*event*/, TSYClientConnection& connection) {
  connection.commandQueue().insertCommand(
      std::make_shared<Step>([](TSYCommandQueue&) -> TSYResult<void> {
        if (deferred == TSYErrorSuccess) return {};
        return TSYFailure(TSYErrorCreate(deferred, std::nullopt, TSYLogIt::no));
      }));
  if (returned == 0) throw std::runtime_error("on purpose");
  return returned;
}

TEST(TSYDispatcher, whatIsDeferredRunsAfterTheHandlerAndItsFailureCounts) {
  const ContainerDevice device;
  const std::pair<TSYCommandHandler, uint64_t> cases[] = {
      {handler<1, 1>, 1},    {handler<1, 28>, 28}, {handler<21, 1>, 21},
      {handler<21, 28>, 28}, {handler<0, 1>, 40},  {handler<0, 28>, 28}};
  for (const auto& [handle, code] : cases) {
    const Message request;
    TSYRelayEvent event{request, Message(), std::nullopt};
    TSYClientConnection connection = unentitledConnection(nullptr);
    const TSYCommandRow row{0, handle, kTSYEntitlementAllowed, true, false, false};
    EXPECT_EQ(runHandler(row, event, connection), code);
    EXPECT_EQ(connection.commandQueue().executeNextCommand().error().code(), TSYErrorQueueEmpty);
  }
}

}  // namespace
