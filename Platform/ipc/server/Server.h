// The message service: a listening socket, its connections and the threads that serve them.
//
// Connections are served by a pool of worker threads around epoll (one-shot), so an idle connection
// costs no thread and a request no hand-over between threads. Requests of one connection are
// handled one at a time and in order. A handler may block: when the last free worker takes a
// request it starts another, up to Limits::workers.
//
// Replies wait in a buffer of the connection until the peer takes them, and nothing more is read
// from it meanwhile. A peer that breaks the protocol, is over a limit or takes too long loses its
// connection, with one line in the log; the service never dies of one.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "Platform/base/Errno.h"
#include "Platform/base/FileDescriptor.h"
#include "Platform/base/SerialQueue.h"
#include "Platform/ipc/Message.h"
#include "Platform/ipc/server/Peer.h"
#include "Platform/os/SystemLog.h"

namespace platform::ipc {

struct Limits {
  unsigned workers = 64;
  unsigned connectionsOfRoot = 4096;
  unsigned connectionsOfUser = 256;
  size_t bufferedBytesOfUser = 64 * 1024 * 1024;
  // Without a byte moved for this long in the middle of a frame or with a reply waiting, a
  // connection ends.
  std::chrono::milliseconds progress{30'000};
};

class ServerConnection;
class ServerCore;

// The right to answer one request, once. May be kept and used later from any thread; one that is
// dropped unused sends nothing.
class ReplyPort {
 public:
  ReplyPort(std::shared_ptr<ServerConnection> connection, uint32_t sequence);
  ReplyPort(ReplyPort&&) noexcept;
  ReplyPort& operator=(ReplyPort&&) noexcept;
  ~ReplyPort();

  // A reply over the size limit is replaced by its "ReplyError" alone, 73.
  void send(const Message& reply) &&;

 private:
  std::shared_ptr<ServerConnection> connection_;
  uint32_t sequence_;
};

// What a handler sees of a connection. Any thread.
class ConnectionHandle {
 public:
  explicit ConnectionHandle(std::shared_ptr<ServerConnection> connection);
  ~ConnectionHandle();
  const Peer& peer() const;
  // Ends the connection: nothing more is read or sent.
  void cancel() const;

 private:
  std::shared_ptr<ServerConnection> connection_;
};

struct Request {
  ConnectionHandle connection;
  Message message;
  std::optional<ReplyPort> reply;  // none: the request has no reply context
};

class Server {
 public:
  using Handler = std::function<void(Request request)>;

  // Binds `socketPath` (mode 0666, any length, replacing a stale socket) or takes `activated` over
  // when it is valid (EINVAL when it is no listening stream socket). Connections are accepted, and
  // their peers identified, on `acceptQueue`; `handler` runs on worker threads. The log, the tasks,
  // the queue and what the handler refers to must outlive the server, and with the log all handles
  // and reply ports.
  static Result<std::unique_ptr<Server>> create(const std::string& socketPath,
                                                FileDescriptor activated, const Tasks& tasks,
                                                const SystemLog& log, SerialQueue& acceptQueue,
                                                Handler handler, Limits limits = {});
  // Waits for the handlers that run, then ends all connections. Not on the accept queue, which must
  // not be suspended, and not on a worker. Reply ports that are left send nothing.
  ~Server();

  // Begins to accept. Call it on the accept queue.
  void resume();
  // Accepts nothing more, takes no further request, and waits until the requests that run have
  // ended and their replies are out, or `timeout` has passed. Returns whether all ended. A reply
  // port that was kept is not waited for; it still works until the server is gone.
  bool drain(std::chrono::milliseconds timeout);

 private:
  explicit Server(std::shared_ptr<ServerCore> core);
  std::shared_ptr<ServerCore> core_;
};

}  // namespace platform::ipc
