// From a request to its reply: who the client is, what he may do, the handler, the reply.
#pragma once

#include <memory>

#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYCommandTable.h"
#include "Platform/ipc/server/Server.h"

// Processes one request and answers it. Runs on a worker of the message service: the requests of
// one connection one at a time, those of different ones at the same time.
void TSYProcessRelayEvent(platform::ipc::Request request);

// The client connection of a request, when the row lets this client in; null when it does not
// (logged), and the request fails with 55. `identity` may be null.
std::unique_ptr<TSYClientConnection> checkEntitlementsAndInitClientObject(
    const TSYCommandRow& row, TSYClientIdentityRef identity, pid_t pid,
    std::shared_ptr<TSYCommandQueue> commandQueue);
