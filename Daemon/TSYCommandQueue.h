// Work that a request defers to its end.
//
// Commands are collected while a request runs, from any thread, and executed afterwards in order,
// one at a time, on a serial queue of their own. A TSYCommandQueue lives for one request or one
// operation of the daemon itself.
#pragma once

#include <cstdint>
#include <list>
#include <memory>

#include "Daemon/TSYError.h"
#include "Platform/base/Mutex.h"
#include "Platform/base/SerialQueue.h"

class TSYCommandQueue;

class TSYCommand {
 public:
  virtual ~TSYCommand() = default;
  // The command's kind, for log lines.
  virtual uint64_t command() const = 0;
  virtual TSYResult<void> fromQueueExecute(TSYCommandQueue& queue) = 0;
};

class TSYCommandQueue {
 public:
  TSYCommandQueue() = default;

  void insertCommand(std::shared_ptr<TSYCommand> command);
  // Fails with the command's error, or with code 77 when none is left.
  TSYResult<void> executeNextCommand();
  // Executes until none is left. The first failure ends it; the commands behind stay queued. Not
  // from a command of this queue, which would wait for itself.
  TSYResult<void> executeAllUntilExhausted();

 private:
  std::shared_ptr<TSYCommand> takeFirst();
  TSYResult<void> execute(TSYCommand& command);

  platform::SerialQueue queue_{"com.veltra.tessaryd.TSYCommandQueue"};
  platform::Mutex monitor_;
  std::list<std::shared_ptr<TSYCommand>> commands_ GUARDED_BY(monitor_);
};
