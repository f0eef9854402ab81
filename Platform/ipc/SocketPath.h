// Unix sockets under paths of any length: bind and connect go through a descriptor of the
// directory (/proc/self/fd/N/NAME) when the path does not fit into sockaddr_un. Any thread.
#pragma once

#include <string>

#include "Platform/base/Errno.h"
#include "Platform/base/FileDescriptor.h"

namespace platform::ipc {

// A listening socket of `type` (SOCK_STREAM, SOCK_SEQPACKET), close-on-exec and non-blocking, with
// the given mode. A socket that nobody listens on is replaced; EADDRINUSE when somebody does.
Result<FileDescriptor> listenAt(const std::string& path, int type, unsigned mode);
// A connected, blocking socket.
Result<FileDescriptor> connectTo(const std::string& path, int type);

}  // namespace platform::ipc
