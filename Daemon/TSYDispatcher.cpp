#include "Daemon/TSYDispatcher.h"

#include <cstring>

#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYEntitlements.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Signpost.h"

using platform::LogLevel;
using platform::Value;
using platform::ipc::Message;

namespace {

// What the entitlements of a client come to for one row of the table.
struct Rights {
  bool entitled = false;
  bool allowOtherIdLookup = false;
  bool unrestricted = false;
  TSYClientConnection::Lookup lookup;
  TSYClientConnection::WipeIdentifiers wipeIdentifiers;
};

bool names(const TSYCommandRow& row, const char* entitlement) {
  return std::strcmp(row.entitlement, entitlement) == 0;
}

void decideWiping(const TSYClientIdentity& client, Rights& rights) {
  const Value* list = client.valueOfEntitlement(kTSYEntitlementWipeContainer);
  if (list != nullptr && list->asArray() != nullptr) {
    rights.entitled = true;
    rights.wipeIdentifiers = *list->asArray();
    return;
  }
  TSYLogWrite(TSYLogLevelError, "No entitled containers to wipe");
  rights.entitled = rights.unrestricted;
}

Rights rightsOf(const TSYClientIdentity& client, const TSYCommandRow& row) {
  Rights rights;
  if (client.boolValueOfEntitlement(kTSYEntitlementAllowed)) {
    rights.allowOtherIdLookup = true;
    rights.unrestricted = !names(row, kTSYEntitlementTestability);
  } else {
    rights.allowOtherIdLookup = client.boolValueOfEntitlement(kTSYEntitlementOtherIdLookup);
    const Value* lookup =
        row.consultsLookup ? client.valueOfEntitlement(kTSYEntitlementLookup) : nullptr;
    if (lookup != nullptr && lookup->asDictionary() != nullptr) {
      rights.lookup = *lookup->asDictionary();
    }
  }
  if (names(row, kTSYEntitlementWipeContainer)) {
    decideWiping(client, rights);
  } else {
    rights.entitled = rights.unrestricted || client.boolValueOfEntitlement(row.entitlement);
  }
  return rights;
}

void registerCaller(const TSYClientIdentity& client, TSYCommandQueue& commandQueue) {
  const auto processed = TSYCatchingExceptions([&]() -> TSYResult<uint64_t> {
    return TSYCodeSigningMapping::sharedInstance().processCallerRegisteredEntitlements(
        client.entitlements(), client.bundleIdentifier(), commandQueue);
  });
  const uint64_t code = processed ? *processed : processed.error().clientCode();
  if (code != TSYErrorSuccess) {
    TSYLogWrite(TSYLogLevelError, "Error processing entitlements for {} : {}",
                client.bundleIdentifier(), code);
  }
}

// The row of a command; null (logged) when there is none.
const TSYCommandRow* rowOf(uint64_t command) {
  if (command >= kTSYCommandCount) {
    TSYLogWrite(TSYLogLevelError, "Invalid command index: {}", static_cast<int64_t>(command));
    return nullptr;
  }
  const TSYCommandRow& row = TSYCommandTable()[command];
  if (row.command != command) {
    TSYLogWrite(TSYLogLevelError, "Invalid command at index {}", command);
    return nullptr;
  }
  return &row;
}

// Runs the handler and then, whatever it returned, what it has deferred: the code of a deferred
// command that fails takes the place of the handler's.
uint64_t runHandler(const TSYCommandRow& row, TSYRelayEvent& event,
                    TSYClientConnection& connection) {
  const auto handled = TSYCatchingExceptions(
      [&]() -> TSYResult<uint64_t> { return row.handler(event, connection); });
  const auto completed = connection.complete();
  if (!completed) return completed.error().clientCode();
  return handled ? *handled : handled.error().clientCode();
}

uint64_t processCommand(uint64_t command, const platform::ipc::Peer& peer, TSYRelayEvent& event,
                        TSYClientIdentityRef& client) {
  const TSYCommandRow* row = rowOf(command);
  if (row == nullptr) return TSYErrorInvalidCommand;
  client = TSYClientIdentity::clientIdentityWithRelayConnection(peer);
  const auto connection = checkEntitlementsAndInitClientObject(*row, client, peer.pid(),
                                                               std::make_shared<TSYCommandQueue>());
  if (!connection) return TSYErrorNotEntitled;
  return runHandler(*row, event, *connection);
}

bool dispatcherReplies(uint64_t command, uint64_t code) {
  return command >= kTSYCommandCount || TSYCommandTable()[command].repliesOnReturn ||
         code != TSYErrorSuccess;
}

}  // namespace

std::unique_ptr<TSYClientConnection> checkEntitlementsAndInitClientObject(
    const TSYCommandRow& row, TSYClientIdentityRef identity, pid_t pid,
    std::shared_ptr<TSYCommandQueue> commandQueue) {
  Rights rights = identity ? rightsOf(*identity, row) : Rights{};
  if (!rights.entitled && !row.allowUnentitled && !rights.lookup) {
    TSYLogWrite(TSYLogLevelError, "connection attempt from pid {} ({}) is not entitled", pid,
                identity ? identity->bundleIdentifier() : "(null)");
    return nullptr;
  }
  if (identity) registerCaller(*identity, *commandQueue);
  return std::make_unique<TSYClientConnection>(
      std::move(identity), rights.entitled, rights.allowOtherIdLookup, rights.unrestricted,
      std::move(rights.lookup), std::move(rights.wipeIdentifiers), std::move(commandQueue));
}

void TSYProcessRelayEvent(platform::ipc::Request request) {
  const uint64_t command = request.message.uint64("Command").value_or(0);
  if (!request.reply) {
    TSYLogWrite(TSYLogLevelError, "Dictionary does not have reply context");
    request.connection.cancel();
    return;
  }
  TSY_SIGNPOST_BEGIN(RelayEventProcessing, &request, command);
  const platform::ipc::Peer& peer = request.connection.peer();
  const TSYUserIdentityCache::CallerContext context(peer.task ? peer.task->personaUniqueString
                                                              : std::nullopt);
  TSYRelayEvent event{request.message, Message(), std::move(request.reply)};
  TSYClientIdentityRef client;
  const uint64_t code = processCommand(command, peer, event, client);

  // The client is not kept waiting for the log.
  if (event.replyPort && dispatcherReplies(command, code)) {
    event.reply.set("ReplyError", code);
    std::move(*event.replyPort).send(event.reply);
  }
  const std::string_view clientName =
      client ? std::string_view(client->bundleIdentifier()) : std::string_view("<unknown>");
  TSY_SIGNPOST_END2(RelayEventProcessing, &request, command, clientName.data());
  TSYSystemLogWrite(TSYChannel::relay, LogLevel::standard, "command={}, client={}, error={}",
                    command, clientName, code);
}
