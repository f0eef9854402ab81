// Commands for what clients keep or share inside containers.
#include "Daemon/TSYCommandHandlers.h"
#include "Daemon/TSYRequestResolvers.h"

namespace {

// The data container that the request means, which must be named.
TSYResolved<TSYContainerIdentity> appDataContainerOf(const TSYRelayEvent& event,
                                                     const TSYClientConnection& connection) {
  const auto identifier =
      TSYResolveIdentifier(event.request, connection, TSYIdentifierFallback::none);
  if (!identifier) return std::unexpected(uint64_t{TSYErrorMissingIdentifier});
  return TSYResolveContainerIdentityOfClass(connection, *identifier, kTSYContainerClassAppData);
}

}  // namespace

uint64_t TSYHandleStageSharedContent(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto staged = connection.stageSharedContentForIdentifier(
      TSYStringUnder(event.request, kTSYRequestIdentifier),
      TSYStringUnder(event.request, "SourcePath"), TSYStringUnder(event.request, "DestPath"));
  if (!staged) return staged.error().clientCode();
  event.reply.set("ReplyPath", staged->path());
  return TSYErrorSuccess;
}

uint64_t TSYHandleUserManagedAssetsPath(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identity = appDataContainerOf(event, connection);
  if (!identity) return identity.error();
  const auto assets = connection.userManagedAssetsPathWithContainerIdentity(
      *identity, event.request.boolean("IsRelative").value_or(false),
      event.request.boolean("CreateIfNecessary").value_or(false));
  if (!assets) return assets.error().clientCode();
  event.reply.set("ReplyPath", assets->path);
  event.reply.set("ReplyExisted", assets->existed);
  return TSYErrorSuccess;
}

uint64_t TSYHandleDeleteUserManagedAsset(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identity = appDataContainerOf(event, connection);
  if (!identity) return identity.error();
  return connection.deleteUserManagedAssetWithContainerIdentity(
      *identity, TSYStringUnder(event.request, "SourcePath"));
}
