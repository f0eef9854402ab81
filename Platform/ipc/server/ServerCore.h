// What the connections of a server share: the listening socket, the workers, the table of
// connections, the limits and the log.
//
// Locks, outermost first: a connection's own, the core's, the pool's and the accounts' (leaves).
// The core never calls a connection with its lock held.
#pragma once

#include <atomic>
#include <memory>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "Platform/base/FileDescriptor.h"
#include "Platform/base/Mutex.h"
#include "Platform/base/SerialQueue.h"
#include "Platform/ipc/server/Server.h"
#include "Platform/ipc/server/ServerConnection.h"
#include "Platform/ipc/server/UserAccounts.h"
#include "Platform/ipc/server/WorkerPool.h"
#include "Platform/os/SystemLog.h"

namespace platform::ipc {

class ServerCore : public std::enable_shared_from_this<ServerCore> {
 public:
  ServerCore(FileDescriptor listener, const Tasks& tasks, const SystemLog& log,
             SerialQueue& acceptQueue, Server::Handler handler, Limits limits);

  // For Server.
  Result<void> open();
  void resume();
  bool drain(std::chrono::milliseconds timeout);
  void stop();

  // For connections.
  WorkerPool& pool() { return pool_; }
  void handle(Request request) { handler_(std::move(request)); }
  void log(LogLevel level, std::string_view function, std::string_view text) const {
    log_.write(level, "relay", function, 0, text);
  }
  // Drawn when drain() has begun: no frame is taken any more.
  bool draining() const { return draining_; }
  // Work that drain() waits for: turns, and replies that wait.
  void beginWork() { ++work_; }
  void endWork();
  // The connection waits for its peer: it is asked from time to time whether it has stalled.
  void watch(uint64_t token) EXCLUDES(mutex_);
  void unwatch(uint64_t token) EXCLUDES(mutex_);
  void forget(uint64_t token) EXCLUDES(mutex_);

 private:
  void takeEvent(uint64_t token, std::span<uint8_t> scratch);
  void serve(uint64_t token, std::span<uint8_t> scratch);
  void acceptPending();
  bool acceptOne();
  FileDescriptor acceptSocket() EXCLUDES(mutex_);
  void admit(FileDescriptor socket);
  void pauseAccepting(int error) EXCLUDES(mutex_);
  void armListener() EXCLUDES(mutex_);
  void keepHouse() EXCLUDES(mutex_);
  void closeListener() REQUIRES(mutex_);
  void setTimer(bool running) REQUIRES(mutex_);

  const Tasks& tasks_;
  const SystemLog& log_;
  SerialQueue& acceptQueue_;
  const Server::Handler handler_;
  const Limits limits_;
  UserAccounts accounts_;

  FileDescriptor timer_;  // set by open()
  std::atomic<bool> draining_ = false;
  std::atomic<int> work_ = 0;

  Mutex mutex_;
  ConditionVariable workEnded_;
  FileDescriptor listener_ GUARDED_BY(mutex_);  // invalid once nothing is accepted any more
  bool acceptingPaused_ GUARDED_BY(mutex_) = false;
  bool shortageLogged_ GUARDED_BY(mutex_) = false;  // since the last connection was accepted
  bool timerRuns_ GUARDED_BY(mutex_) = false;
  uint64_t nextToken_ GUARDED_BY(mutex_);
  std::unordered_map<uint64_t, std::shared_ptr<ServerConnection>> connections_ GUARDED_BY(mutex_);
  std::unordered_set<uint64_t> watched_ GUARDED_BY(mutex_);

  WorkerPool pool_;
};

}  // namespace platform::ipc
