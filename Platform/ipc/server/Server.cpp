#include "Platform/ipc/server/Server.h"

#include <fcntl.h>
#include <sys/socket.h>

#include <utility>

#include "Platform/ipc/Codec.h"
#include "Platform/ipc/SocketPath.h"
#include "Platform/ipc/server/ServerConnection.h"
#include "Platform/ipc/server/ServerCore.h"

namespace platform::ipc {
namespace {

constexpr unsigned kSocketMode = 0666;
constexpr uint64_t kReplyTooLarge = 73;

int socketOption(int socket, int option) {
  int value = 0;
  socklen_t size = sizeof value;
  return ::getsockopt(socket, SOL_SOCKET, option, &value, &size) == 0 ? value : -1;
}

// The socket that the service manager listens on.
Result<FileDescriptor> takeOver(FileDescriptor activated) {
  const int socket = activated.get();
  if (socketOption(socket, SO_DOMAIN) != AF_UNIX || socketOption(socket, SO_TYPE) != SOCK_STREAM ||
      socketOption(socket, SO_ACCEPTCONN) != 1) {
    return failWith(EINVAL);
  }
  const int flags = ::fcntl(socket, F_GETFL);
  if (flags < 0 || ::fcntl(socket, F_SETFL, flags | O_NONBLOCK) < 0 ||
      ::fcntl(socket, F_SETFD, FD_CLOEXEC) < 0) {
    return lastErrno();
  }
  return activated;
}

}  // namespace

ReplyPort::ReplyPort(std::shared_ptr<ServerConnection> connection, uint32_t sequence)
    : connection_(std::move(connection)), sequence_(sequence) {}
ReplyPort::ReplyPort(ReplyPort&&) noexcept = default;
ReplyPort& ReplyPort::operator=(ReplyPort&&) noexcept = default;
ReplyPort::~ReplyPort() = default;

void ReplyPort::send(const Message& reply) && {
  const auto connection = std::exchange(connection_, nullptr);
  if (connection == nullptr) return;
  auto frame = encodeFrame(reply, sequence_, kReplyFlag);
  if (!frame) {
    Message error;
    error.set("ReplyError", kReplyTooLarge);
    frame = encodeFrame(error, sequence_, kReplyFlag);
  }
  connection->send(std::move(*frame));
}

ConnectionHandle::ConnectionHandle(std::shared_ptr<ServerConnection> connection)
    : connection_(std::move(connection)) {}
ConnectionHandle::~ConnectionHandle() = default;

const Peer& ConnectionHandle::peer() const {
  return connection_->peer();
}
void ConnectionHandle::cancel() const {
  connection_->end("");
}

Result<std::unique_ptr<Server>> Server::create(const std::string& socketPath,
                                               FileDescriptor activated, const Tasks& tasks,
                                               const SystemLog& log, SerialQueue& acceptQueue,
                                               Handler handler, Limits limits) {
  auto listener = activated.valid() ? takeOver(std::move(activated))
                                    : listenAt(socketPath, SOCK_STREAM, kSocketMode);
  if (!listener) return std::unexpected(listener.error());
  auto core = std::make_shared<ServerCore>(std::move(*listener), tasks, log, acceptQueue,
                                           std::move(handler), limits);
  if (const auto opened = core->open(); !opened) return std::unexpected(opened.error());
  if (!kernelHasPeerDescriptors()) {
    core->log(LogLevel::standard, __func__,
              "this kernel gives no descriptors of peers; a reused pid can be taken for a peer");
  }
  return std::unique_ptr<Server>(new Server(std::move(core)));
}

Server::Server(std::shared_ptr<ServerCore> core) : core_(std::move(core)) {}
Server::~Server() {
  core_->stop();
}

void Server::resume() {
  core_->resume();
}
bool Server::drain(std::chrono::milliseconds timeout) {
  return core_->drain(timeout);
}

}  // namespace platform::ipc
