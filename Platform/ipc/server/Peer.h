// Who is at the other end of a connection. Made once, when the connection is accepted.
#pragma once

#include <optional>

#include "Platform/base/Errno.h"
#include "Platform/os/AuditToken.h"
#include "Platform/os/Tasks.h"

namespace platform::ipc {

struct Peer {
  AuditToken token;
  std::optional<TaskRecord> task;  // none: the process has no identity

  uid_t uid() const { return token.effectiveUID(); }
  gid_t gid() const { return token.effectiveGID(); }
  pid_t pid() const { return token.pid(); }
};

// Reads SO_PEERCRED, the start time and the record of the peer. Where the kernel gives a pidfd of
// the peer, the process must still live after both were read, so that a reused pid is never taken
// for it (ESRCH otherwise). EPERM for a peer of another pid namespace.
Result<Peer> identifyPeer(int socket, const Tasks& tasks);

// Whether the kernel gives pidfds of peers. Without them a reused pid can be taken for the peer.
bool kernelHasPeerDescriptors();

}  // namespace platform::ipc
