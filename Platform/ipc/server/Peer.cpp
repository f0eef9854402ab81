#include "Platform/ipc/server/Peer.h"

#include <poll.h>
#include <sys/socket.h>

#include "Platform/base/FileDescriptor.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace platform::ipc {
namespace {

// What passes: the peer is not to lose its identity over it, but may try again.
bool isShortage(int error) {
  return error == EMFILE || error == ENFILE || error == ENOMEM;
}

// A pidfd of the peer; an invalid one where the kernel has none to give.
Result<FileDescriptor> pidfdOfPeer(int socket) {
  int descriptor = -1;
  socklen_t size = sizeof descriptor;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERPIDFD, &descriptor, &size) == 0) {
    return FileDescriptor(descriptor);
  }
  if (errno == ENOPROTOOPT) return FileDescriptor();
  // What the kernel says of a process that is already gone depends on its version.
  if (isShortage(errno)) return lastErrno();
  return failWith(ESRCH);
}

bool hasEnded(const FileDescriptor& pidfd) {
  pollfd poll = {.fd = pidfd.get(), .events = POLLIN, .revents = 0};
  return ::poll(&poll, 1, 0) != 0;
}

}  // namespace

Result<Peer> identifyPeer(int socket, const Tasks& tasks) {
  ucred credentials{};
  socklen_t size = sizeof credentials;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) return lastErrno();
  if (credentials.pid <= 0) return failWith(EPERM);
  const auto pidfd = pidfdOfPeer(socket);
  if (!pidfd) return std::unexpected(pidfd.error());

  const auto startTime = processStartTime(credentials.pid);
  if (!startTime) return std::unexpected(startTime.error());
  auto record = tasks.record(credentials.pid, *startTime);
  if (!record && isShortage(record.error().value)) return std::unexpected(record.error());
  if (pidfd->valid() && hasEnded(*pidfd)) return failWith(ESRCH);

  Peer peer = {
      .token = AuditToken::make(credentials.uid, credentials.gid, credentials.pid, *startTime),
      .task = std::nullopt};
  if (record) peer.task = std::move(*record);
  return peer;
}

bool kernelHasPeerDescriptors() {
  int pair[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) return true;
  const FileDescriptor first(pair[0]);
  const FileDescriptor second(pair[1]);
  const auto pidfd = pidfdOfPeer(first.get());
  return !pidfd || pidfd->valid();
}

}  // namespace platform::ipc
