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
// A command that there was once.
uint64_t TSYHandleRetired(TSYRelayEvent& event, TSYClientConnection& connection);
// A command whose operation is not built yet.
uint64_t TSYHandleNotBuilt(TSYRelayEvent& event, TSYClientConnection& connection);
