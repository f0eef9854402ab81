// Commands that read or change one existing container.
#include "Daemon/TSYCommandHandlers.h"
#include "Daemon/TSYPropertyList.h"
#include "Daemon/TSYRequestResolvers.h"

using platform::Value;

namespace {

constexpr char kKey[] = "Key";

uint64_t codeOf(const TSYResult<void>& result) {
  return result ? uint64_t{TSYErrorSuccess} : result.error().clientCode();
}

}  // namespace

uint64_t TSYHandleSetInfoValue(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identity = TSYResolveConcreteContainerIdentity(event.request, connection);
  if (!identity) return identity.error();
  std::optional<Value> value;
  if (const Value* given = event.request.value("Value")) {
    if (!TSYHasPropertyListForm(*given)) return TSYErrorInvalidArgument;
    value = *given;
  }
  return codeOf(connection.setInfoValue(value, TSYStringUnder(event.request, kKey), *identity,
                                        /*useLocking=*/true));
}

uint64_t TSYHandleGetInfoValue(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identity = TSYResolveConcreteContainerIdentity(event.request, connection);
  if (!identity) return identity.error();
  auto value = connection.infoValueForKey(TSYStringUnder(event.request, kKey), *identity,
                                          /*useLocking=*/true);
  if (!value) return value.error().clientCode();
  event.reply.set("ReplyInfoValue", std::move(*value));
  return TSYErrorSuccess;
}

uint64_t TSYHandleGetMetadata(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identity = TSYResolveConcreteContainerIdentity(event.request, connection);
  if (!identity) return identity.error();
  const auto found = connection.metadataWithContainerIdentity(*identity);
  if (!found) return found.error().clientCode();
  const TSYMetadata& container = **found;
  event.reply.set("ReplyPath", container.url().path());
  event.reply.set("ReplyTransient", container.transient());
  if (container.info() && event.request.boolean("InfoDictRequested").value_or(false)) {
    event.reply.set("ReplyInfoDictionary", *container.info());
  }
  if (const auto persona = TSYPersonaUniqueStringOf(container)) {
    event.reply.set("ReplyPersonaUniqueString", *persona);
  }
  if (connection.clientIdentity()) {
    if (auto token = TSYIssueSandboxExtension(container, *connection.clientIdentity())) {
      event.reply.set("ReplySandboxToken", std::move(*token));
    }
  }
  return TSYErrorSuccess;
}

uint64_t TSYHandleRecreateStructure(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identity = TSYResolveConcreteContainerIdentity(event.request, connection);
  if (!identity) return identity.error();
  return codeOf(connection.recreateDefaultStructureWithContainerIdentity(*identity));
}

uint64_t TSYHandleRegenerateUUID(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identity = TSYResolveConcreteContainerIdentity(event.request, connection);
  if (!identity) return identity.error();
  return codeOf(connection.regenerateDirectoryUUIDWithContainerIdentity(*identity));
}

uint64_t TSYHandleDiskUsage(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identity = TSYResolveConcreteContainerIdentity(event.request, connection);
  if (!identity) return identity.error();
  const auto bytes = connection.diskUsageWithContainerIdentity(*identity);
  if (!bytes) return bytes.error().clientCode();
  event.reply.set("ReplyDiskUsage", *bytes);
  return TSYErrorSuccess;
}
