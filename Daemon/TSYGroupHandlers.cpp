// Commands that tell an owner's groups and where they are.
#include <algorithm>

#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYCommandHandlers.h"
#include "Daemon/TSYGroupManager.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYRequestResolvers.h"
#include "Daemon/TSYWhitelist.h"

using platform::Value;

namespace {

std::optional<std::string> ownerOf(const TSYRelayEvent& event,
                                   const TSYClientConnection& connection) {
  return TSYResolveIdentifier(event.request, connection, TSYIdentifierFallback::client);
}

Value::Dictionary pathsOf(const TSYClientConnection::GroupContainers& containers) {
  Value::Dictionary paths;
  for (const auto& [group, container] : containers) paths.emplace(group, container->url().path());
  return paths;
}

// What a sandboxed client is told besides.
void addPersonasAndTokens(const TSYClientConnection::GroupContainers& containers,
                          const TSYClientIdentity& client, TSYRelayEvent& event) {
  Value::Dictionary tokens;
  Value::Dictionary personas;
  for (const auto& [group, container] : containers) {
    if (auto token = TSYIssueSandboxExtension(*container, client)) {
      tokens.emplace(group, std::move(*token));
    }
    if (const auto persona = TSYPersonaUniqueStringOf(*container)) {
      personas.emplace(group, *persona);
    }
  }
  if (!tokens.empty()) event.reply.set("ReplySandboxTokenDict", std::move(tokens));
  if (!personas.empty()) event.reply.set("ReplyPersonaUniqueStringDict", std::move(personas));
}

// The container of a group that the client's own entitlements name. Made when it is not there.
TSYMetadataRef makeOrFindOwnGroup(TSYClientConnection& connection, const std::string& owner,
                                  const TSYUserIdentityRef& userIdentity,
                                  const std::string& group) {
  const auto containers = connection.groupContainersForOwnerIdentifier(
      owner, userIdentity, kTSYContainerClassSystemGroup);
  if (containers) {
    const auto found = containers->find(group);
    return found == containers->end() ? nullptr : found->second;
  }
  TSYLogWrite(TSYLogLevelError,
              "No results returned for group container query for identity: {}, error: {}",
              connection.clientBundleIdentifier(), containers.error().clientCode());
  return nullptr;
}

// The container of a group that is open to every client. Made when it is not there; the connection
// may look it up from then on.
TSYMetadataRef makeOrFindOpenGroup(TSYClientConnection& connection,
                                   const TSYUserIdentityRef& userIdentity,
                                   const std::string& group) {
  connection.setAllowGroupIdLookup(/*allow=*/true);
  const auto identity = TSYContainerIdentity::containerIdentityWithUserIdentity(
      userIdentity, group, kTSYContainerClassSystemGroup);
  if (!identity) {
    TSYLogWrite(TSYLogLevelError,
                "Could not generate a container identity for system group lookup identifier: {}, "
                "class: {}, userIdentity: {}, error: {}",
                group, kTSYContainerClassSystemGroup, userIdentity->shortDescription(),
                identity.error().clientCode());
    return nullptr;
  }
  const auto found = connection.createOrLookupContainerWithContainerIdentity(
      *identity, /*createIfNecessary=*/true, /*transient=*/false, /*useLocking=*/true);
  if (found) return *found;
  TSYLogWrite(TSYLogLevelError,
              "No results returned for system group lookup identity: {}, error: {}",
              identity->description(), found.error().clientCode());
  return nullptr;
}

}  // namespace

uint64_t TSYHandleGroupContainersForOwner(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto owner = ownerOf(event, connection);
  if (!owner) return TSYErrorMissingIdentifier;
  const auto userIdentity = TSYResolveUserIdentityForGroupOwner(connection, *owner);
  if (!userIdentity) return userIdentity.error();
  const auto containers = connection.groupContainersForOwnerIdentifier(*owner, *userIdentity,
                                                                       kTSYContainerClassAppGroup);
  if (!containers) return containers.error().clientCode();
  event.reply.set("ReplyGroupContainerDict", pathsOf(*containers));
  const TSYClientIdentityRef& client = connection.clientIdentity();
  if (client->sandboxed()) addPersonasAndTokens(*containers, *client, event);
  return TSYErrorSuccess;
}

uint64_t TSYHandleGroupIdentifiersForOwner(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto owner = ownerOf(event, connection);
  if (!owner) {
    return TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                          "Can't act on an invalid object: ID: {}", "(null)")
        .code();
  }
  const auto groups = TSYGroupManager::defaultManager().groupContainerIdentifiersForOwnerIdentifier(
      *owner, kTSYContainerClassAppGroup, /*useLocking=*/true);
  if (!groups) return groups.error().clientCode();
  event.reply.set("ReplyGroupIdentifiersArray", Value::Array(groups->begin(), groups->end()));
  return TSYErrorSuccess;
}

uint64_t TSYHandleSystemGroupContainersForOwner(TSYRelayEvent& event,
                                                TSYClientConnection& connection) {
  const auto owner = ownerOf(event, connection);
  if (!owner) return TSYErrorMissingIdentifier;
  const auto userIdentity =
      TSYResolveUserIdentityForIdentifier(connection, *owner, kTSYContainerClassSystemGroup);
  if (!userIdentity) return userIdentity.error();
  const auto containers = connection.groupContainersForOwnerIdentifier(
      *owner, *userIdentity, kTSYContainerClassSystemGroup);
  if (!containers) return containers.error().clientCode();
  event.reply.set("ReplyGroupContainerDict", pathsOf(*containers));
  return TSYErrorSuccess;
}

uint64_t TSYHandleSystemGroupContainerPath(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto owner = ownerOf(event, connection);
  if (!owner) return TSYErrorMissingIdentifier;
  const std::string& client = connection.clientBundleIdentifier();
  const auto entitled =
      TSYCodeSigningMapping::sharedInstance().systemGroupIdentifiersForIdentifier(client);
  const auto group = TSYStringUnder(event.request, "GroupIdentifier");
  TSYLogWrite(TSYLogLevelDebug, "Group ID: {}, bundle ID: {}, entitled group container IDs: {}",
              group.value_or("(null)"), client, TSYListText(entitled));
  const auto userIdentity =
      TSYResolveUserIdentityForIdentifier(connection, *owner, kTSYContainerClassSystemGroup);
  if (!userIdentity) {
    TSYLogWrite(TSYLogLevelError,
                "Could not generate a user identity for bundle: {}, class: {}, error: {}", *owner,
                kTSYContainerClassSystemGroup, userIdentity.error());
    return userIdentity.error();
  }
  const bool isOwn = group && entitled && std::ranges::find(*entitled, *group) != entitled->end();
  const bool isOpen =
      group && TSYWhitelist::sharedWhitelist().systemGroupContainerIdIsWellknown(*group);
  if (!isOwn && !isOpen) {
    TSYLogWrite(TSYLogLevelError,
                "{} is not entitled for system group identifier: {}.  Only entitled for: {}",
                client, group.value_or("(null)"), TSYListText(entitled));
    return TSYErrorNotEntitled;
  }
  const TSYMetadataRef container =
      isOwn ? makeOrFindOwnGroup(connection, *owner, *userIdentity, *group)
            : makeOrFindOpenGroup(connection, *userIdentity, *group);
  if (!container) {
    TSYLogWrite(TSYLogLevelError, "Did not find system group container with identifier: {} for {}",
                *group, *owner);
    return TSYErrorNotFound;
  }
  event.reply.set("ReplyPath", container->url().path());
  return TSYErrorSuccess;
}
