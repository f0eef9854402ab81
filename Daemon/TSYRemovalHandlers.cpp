// Commands that take containers away or put others in their place.
#include "Daemon/TSYCommandHandlers.h"
#include "Daemon/TSYCommandStageForDelete.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYRequestResolvers.h"

using platform::Value;
using platform::ipc::Message;
using platform::ipc::ReplyPort;

namespace {

constexpr TSYConcreteKeys kOldContainer{.identifier = "OldIdentifier",
                                        .containerClass = "OldContainerClass",
                                        .uuid = "OldContainerUUID",
                                        .persona = "OldPersonaUniqueString"};
constexpr TSYConcreteKeys kNewContainer{.identifier = "NewIdentifier",
                                        .containerClass = "NewContainerClass",
                                        .uuid = "NewContainerUUID",
                                        .persona = "NewPersonaUniqueString"};

// The four parallel arrays of a request to stage containers.
struct StagingArrays {
  const Value::Array& classes;
  const Value::Array& uuids;
  const Value::Array& identifiers;
  const Value::Array& personas;
};

const Value::Array& arrayUnder(const Message& request, std::string_view key) {
  static const Value::Array empty;
  const Value::Array* array = request.array(key);
  return array == nullptr ? empty : *array;
}

TSYResolved<TSYUserIdentityRef> ownerAt(const StagingArrays& arrays, size_t index,
                                        TSYContainerClass containerClass,
                                        const TSYClientConnection& connection) {
  if (!TSYUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
    return TSYUserIdentitySharedCache::sharedInstance().userIdentityForCurrentContext();
  }
  // As in a listing, the empty string stands for none.
  const std::string* persona = arrays.personas[index].asString();
  const bool isNone = persona == nullptr || persona->empty();
  return TSYResolvePersona(connection, isNone ? std::nullopt : std::optional(*persona));
}

TSYResolved<TSYContainerIdentityRef> identityAt(const StagingArrays& arrays, size_t index,
                                                const TSYClientConnection& connection) {
  const TSYContainerClass containerClass = arrays.classes[index].asUInt64().value_or(0);
  auto owner = ownerAt(arrays, index, containerClass, connection);
  if (!owner) return std::unexpected(owner.error());
  const std::string* identifier = arrays.identifiers[index].asString();
  if (identifier == nullptr) return std::unexpected(uint64_t{TSYErrorMissingIdentifier});
  const platform::UUID* uuid = arrays.uuids[index].asUUID();
  auto identity = TSYConcreteContainerIdentity::containerIdentityWithUUID(
      uuid == nullptr ? std::nullopt : std::optional(*uuid), std::move(*owner), *identifier,
      containerClass);
  if (!identity) return std::unexpected(identity.error().clientCode());
  return std::make_shared<const TSYConcreteContainerIdentity>(std::move(*identity));
}

uint64_t wipe(const TSYRelayEvent& event, TSYClientConnection& connection,
              TSYContainerClass containerClass) {
  const std::string* identifier = event.request.string(kTSYRequestIdentifier);
  if (identifier == nullptr) {
    TSYLogWrite(TSYLogLevelError, "Can't wipe container with nil identifier: {}", "(null)");
    return TSYErrorMissingIdentifier;
  }
  const auto identity = TSYResolveContainerIdentityOfClass(connection, *identifier, containerClass);
  if (!identity) return identity.error();
  return connection.deleteDataContainerContentWithContainerIdentity(*identity);
}

}  // namespace

// Without the UUID of an old container the new one becomes a regular container.
uint64_t TSYHandleReplaceContainer(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto old = TSYResolveNamedContainerIdentity(event.request, connection, kOldContainer);
  if (!old) return old.error();
  const auto named = TSYResolveNamedContainerIdentity(event.request, connection, kNewContainer);
  if (!named) return named.error();
  const auto* replacement = TSYConcreteContainerIdentity::orNull(**named);
  if (replacement == nullptr) {
    return TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                          "Can't act on an invalid object: newUUID: {}, Class: {}", "(null)",
                          (*named)->containerClass())
        .code();
  }
  return connection.replaceContainerIdentity(**old, *replacement, /*preserveOldUUID=*/false,
                                             /*startDeletionThread=*/false);
}

uint64_t TSYHandleStageForDelete(TSYRelayEvent& event, TSYClientConnection& connection) {
  const StagingArrays arrays{.classes = arrayUnder(event.request, "ContainerClassesArray"),
                             .uuids = arrayUnder(event.request, "UUIDsArray"),
                             .identifiers = arrayUnder(event.request, "IdentifiersArray"),
                             .personas = arrayUnder(event.request, "PersonaUniqueStringsArray")};
  const size_t count = arrays.classes.size();
  if (arrays.uuids.size() != count || arrays.identifiers.size() != count ||
      arrays.personas.size() != count) {
    TSYLogWrite(TSYLogLevelError,
                "Can't act on an invalid input: UUIDString count: {}, class count: {}, ID count: "
                "{}, persona string count: {}",
                arrays.uuids.size(), count, arrays.identifiers.size(), arrays.personas.size());
    return TSYErrorInvalidArgument;
  }
  std::vector<TSYContainerIdentityRef> identities;
  for (size_t index = 0; index < count; ++index) {
    auto identity = identityAt(arrays, index, connection);
    if (!identity) return identity.error();
    identities.push_back(std::move(*identity));
  }
  connection.commandQueue().insertCommand(
      TSYCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
          std::move(identities), /*useLocking=*/true, /*onError=*/nullptr));
  return TSYErrorSuccess;
}

uint64_t TSYHandleEmptyDeathRow(TSYRelayEvent& event, TSYClientConnection& /*connection*/) {
  // Shared because a queue's work must be copyable.
  auto replyPort = std::make_shared<ReplyPort>(std::move(*event.replyPort));
  event.replyPort.reset();
  TSYClientConnection::deleteContainersOnDeathRowWithCompletion(
      [replyPort, reply = std::move(event.reply)](uint64_t code) mutable {
        reply.set("ReplyError", code);
        std::move(*replyPort).send(reply);
      });
  return TSYErrorSuccess;
}

uint64_t TSYHandleDeleteContainer(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identity =
      TSYResolveContainerIdentity(event.request, connection, TSYIdentifierFallback::none);
  if (!identity) return identity.error();
  return connection.deleteContainerWithContainerIdentity(
      *identity, event.request.boolean("Transient").value_or(false));
}

uint64_t TSYHandleWipePluginData(TSYRelayEvent& event, TSYClientConnection& connection) {
  return wipe(event, connection, kTSYContainerClassPluginData);
}

uint64_t TSYHandleDeleteDataContent(TSYRelayEvent& event, TSYClientConnection& connection) {
  connection.setUnrestricted(/*unrestricted=*/true);
  return wipe(event, connection, event.request.uint64(kTSYRequestContainerClass).value_or(0));
}
