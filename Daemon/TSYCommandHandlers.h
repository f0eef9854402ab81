// The handlers of the commands. Each reads the keys of its request, calls one operation of the
// client connection and writes the keys of the reply; a handler that fails adds none.
//
// They run on the worker that took the request and return a TSYErrorCode.
#pragma once

#include "Daemon/TSYCommandTable.h"

uint64_t TSYHandleCreateOrLookup(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleContainersOfClass(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleSystemContainerPath(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandlePersonaList(TSYRelayEvent& event, TSYClientConnection& connection);

// TSYRemovalHandlers.cpp
uint64_t TSYHandleReplaceContainer(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleStageForDelete(TSYRelayEvent& event, TSYClientConnection& connection);
// Replies when death row has been emptied.
uint64_t TSYHandleEmptyDeathRow(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleDeleteContainer(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleWipePluginData(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleDeleteDataContent(TSYRelayEvent& event, TSYClientConnection& connection);

// TSYInfoHandlers.cpp
uint64_t TSYHandleSetInfoValue(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleGetInfoValue(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleGetMetadata(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleRecreateStructure(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleRegenerateUUID(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleDiskUsage(TSYRelayEvent& event, TSYClientConnection& connection);

// TSYGroupHandlers.cpp
uint64_t TSYHandleGroupContainersForOwner(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleGroupIdentifiersForOwner(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleSystemGroupContainersForOwner(TSYRelayEvent& event,
                                                TSYClientConnection& connection);
uint64_t TSYHandleSystemGroupContainerPath(TSYRelayEvent& event, TSYClientConnection& connection);

// TSYCodeSigningHandlers.cpp
uint64_t TSYHandleRegisterCodeSigningInfo(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleGetCodeSigningInfo(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleInvalidateCodeSigningInfo(TSYRelayEvent& event, TSYClientConnection& connection);

// TSYSharedContentHandlers.cpp
uint64_t TSYHandleStageSharedContent(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleUserManagedAssetsPath(TSYRelayEvent& event, TSYClientConnection& connection);
uint64_t TSYHandleDeleteUserManagedAsset(TSYRelayEvent& event, TSYClientConnection& connection);

// A command that there was once.
uint64_t TSYHandleRetired(TSYRelayEvent& event, TSYClientConnection& connection);
// A command whose operation is not built yet.
uint64_t TSYHandleNotBuilt(TSYRelayEvent& event, TSYClientConnection& connection);
