// Threads that wait for descriptors to become ready and take the events one at a time.
//
// Every descriptor is armed for one event: after that it is quiet until it is armed again, so that
// two workers are never given the same one. When the last free worker takes an event it starts
// another, up to the maximum; workers stay until the pool is stopped.
#pragma once

#include <sys/epoll.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <span>
#include <thread>
#include <vector>

#include "Platform/base/Errno.h"
#include "Platform/base/FileDescriptor.h"
#include "Platform/base/Mutex.h"
#include "Platform/os/SystemLog.h"

namespace platform::ipc {

class WorkerPool {
 public:
  // `scratch` is the worker's own memory, for the length of the call.
  using EventHandler = std::function<void(uint64_t token, std::span<uint8_t> scratch)>;

  // `handler` must not throw.
  WorkerPool(unsigned maximumWorkers, const SystemLog& log, EventHandler handler);
  ~WorkerPool();
  WorkerPool(const WorkerPool&) = delete;
  WorkerPool& operator=(const WorkerPool&) = delete;

  // Opens the descriptors. Once, before anything else.
  Result<void> open();
  // Starts the first worker.
  void start();
  // Ends the workers and waits for them. Not on a worker.
  void stop();

  // Watches a descriptor, armed for one of `events` (EPOLLIN, EPOLLOUT; an error or hang-up always
  // counts). The token comes with the event and must not be kStopToken. Closing the descriptor ends
  // the watch. Any thread.
  Result<void> add(int descriptor, uint64_t token, uint32_t events);
  void arm(int descriptor, uint64_t token, uint32_t events);
  void remove(int descriptor);

  // Whether events find a worker: only then may one of them wait for something else for long.
  bool hasFreeWorker() const { return free_ > 0; }

  static constexpr uint64_t kStopToken = UINT64_MAX;

 private:
  void startWorker();
  void run();

  const unsigned maximumWorkers_;
  const SystemLog& log_;
  const EventHandler handler_;
  FileDescriptor epoll_;
  FileDescriptor stopEvent_;
  std::atomic<int> free_ = 0;
  Mutex mutex_;
  bool stopping_ GUARDED_BY(mutex_) = false;
  std::vector<std::thread> workers_ GUARDED_BY(mutex_);
};

}  // namespace platform::ipc
