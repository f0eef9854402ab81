// The command table: for each command number its handler, the entitlement that grants it, and how
// clients without that entitlement are treated.
#pragma once

#include <array>
#include <cstdint>
#include <optional>

#include "Daemon/TSYClientConnection.h"
#include "Platform/ipc/Message.h"
#include "Platform/ipc/server/Server.h"

// One request on its way through a handler.
struct TSYRelayEvent {
  const platform::ipc::Message& request;
  platform::ipc::Message reply;
  // The right to answer. A handler that replies later moves it out; while it is here, the
  // dispatcher answers.
  std::optional<platform::ipc::ReplyPort> replyPort;
};

// Returns a TSYErrorCode. Runs on the worker that took the request.
using TSYCommandHandler = uint64_t (*)(TSYRelayEvent& event, TSYClientConnection& connection);

struct TSYCommandRow {
  uint64_t command;  // equals the row's index
  TSYCommandHandler handler;
  const char* entitlement;
  // The dispatcher always sends the reply; if not, it sends one only on failure, and on success the
  // handler has taken the reply port.
  bool repliesOnReturn;
  // The command runs even for a client without the entitlement, who then sees only what the
  // operation lets him see.
  bool allowUnentitled;
  // The lookup dictionary of a client without "allowed" is read; having one lets the command run.
  bool consultsLookup;
};

inline constexpr size_t kTSYCommandCount = 33;

const std::array<TSYCommandRow, kTSYCommandCount>& TSYCommandTable();
