#include "Daemon/TSYCommandHandlers.h"

#include "Daemon/TSYLog.h"
#include "Daemon/TSYRequestResolvers.h"
#include "Daemon/TSYWhitelist.h"

using platform::Value;

uint64_t TSYHandleCreateOrLookup(TSYRelayEvent& event, TSYClientConnection& connection) {
  auto identity =
      TSYResolveContainerIdentity(event.request, connection, TSYIdentifierFallback::client);
  if (!identity) return identity.error();
  const auto found = connection.createOrLookupContainerWithContainerIdentity(
      std::move(*identity), event.request.boolean("CreateIfNecessary").value_or(false),
      event.request.boolean("Transient").value_or(false), /*useLocking=*/true);
  if (!found) return found.error().clientCode();

  const TSYMetadata& container = **found;
  event.reply.set("ReplyUUID", container.uuid());
  event.reply.set("ReplyExisted", container.existed());
  event.reply.set("ReplyPath", container.url().path());
  event.reply.set("ReplyIdentifier", container.identifier());
  if (const auto persona = TSYPersonaUniqueStringOf(container)) {
    event.reply.set("ReplyPersonaUniqueString", *persona);
  }
  if (auto token = TSYIssueSandboxExtension(container, *connection.clientIdentity())) {
    event.reply.set("ReplySandboxToken", std::move(*token));
  }
  return TSYErrorSuccess;
}

uint64_t TSYHandleContainersOfClass(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto containers =
      connection.containersWithClass(event.request.uint64(kTSYRequestContainerClass).value_or(0),
                                     event.request.boolean("Transient").value_or(false));
  if (!containers) return containers.error().clientCode();
  Value::Array identifiers;
  Value::Array uuids;
  Value::Array personas;
  for (const TSYMetadataRef& container : *containers) {
    identifiers.emplace_back(container->identifier());
    uuids.emplace_back(container->uuid());
    personas.emplace_back(TSYPersonaUniqueStringOf(*container).value_or(""));
  }
  event.reply.set("ReplyIdsArray", std::move(identifiers));
  event.reply.set("ReplyUUIDsArray", std::move(uuids));
  event.reply.set("ReplyPersonaUniqueStringsArray", std::move(personas));
  return TSYErrorSuccess;
}

uint64_t TSYHandleSystemContainerPath(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identifier =
      TSYResolveIdentifier(event.request, connection, TSYIdentifierFallback::client);
  if (!identifier) return TSYErrorMissingIdentifier;
  if (*identifier != connection.clientBundleIdentifier() && !connection.allowOtherIdLookup() &&
      TSYWhitelist::sharedWhitelist().systemContainerIdIsWellknown(*identifier)) {
    connection.setAllowOtherIdLookup(/*allow=*/true);
  }
  auto identity =
      TSYResolveContainerIdentityOfClass(connection, *identifier, kTSYContainerClassSystemData);
  if (!identity) return identity.error();
  const auto found = connection.createOrLookupContainerWithContainerIdentity(
      std::move(*identity), /*createIfNecessary=*/true, /*transient=*/false, /*useLocking=*/true);
  if (!found) return found.error().clientCode();
  event.reply.set("ReplyPath", (*found)->url().path());
  return TSYErrorSuccess;
}

uint64_t TSYHandlePersonaList(TSYRelayEvent& event, TSYClientConnection& connection) {
  Value::Array personas;
  const auto add = [&personas](const TSYUserIdentityRef& identity) {
    if (identity && identity->personaUniqueString()) {
      personas.emplace_back(*identity->personaUniqueString());
    }
  };
  // A process without an identity has no persona, and is told of none.
  const TSYUserIdentityRef own = connection.clientUserIdentity();
  if (own && own->isNoSpecificPersona()) {
    TSYUserIdentitySharedCache::sharedInstance()
        .forEachAccessibleUserIdentitySynchronouslyExecuteBlock(add);
  } else {
    add(own);
  }
  event.reply.set("ReplyPersonaUniqueStringsArray", std::move(personas));
  return TSYErrorSuccess;
}

uint64_t TSYHandleRetired(TSYRelayEvent& /*event*/, TSYClientConnection& /*connection*/) {
  return TSYErrorInvalidCommand;
}

uint64_t TSYHandleNotBuilt(TSYRelayEvent& event, TSYClientConnection& connection) {
  TSYLogWrite(TSYLogLevelError, "Command {} of {} is not built yet",
              event.request.uint64("Command").value_or(0), connection.clientBundleIdentifier());
  return TSYErrorInvalidCommand;
}
