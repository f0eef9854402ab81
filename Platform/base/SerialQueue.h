// A queue that runs one piece of work at a time, in the order in which it was handed in.
//
// Synchronous work runs inline, on the thread of its caller, when its turn has come. Asynchronous
// work runs on a thread of the queue's own, which is started by the first of it: a queue that is
// only ever used synchronously has no thread. While the queue is suspended neither runs; what is
// running already is not interrupted.
//
// To the thread-safety analysis a queue is a capability: what may only be touched on it is
// GUARDED_BY it, and a piece of work begins with assertCurrent().
//
// All operations may be called from any thread. A synchronous call on the queue that is current
// would wait for itself and stops the process.
#pragma once

#include <deque>
#include <functional>
#include <optional>
#include <string>
#include <thread>
#include <type_traits>

#include "Platform/base/Mutex.h"

namespace platform {

// The weight of a queue's own thread: background work yields CPU and disk to everything else.
enum class QueuePriority { normal, background };

class CAPABILITY("queue") SerialQueue {
 public:
  explicit SerialQueue(std::string label, QueuePriority priority = QueuePriority::normal);
  // Runs what was handed in before, then ends the thread. A suspended queue drops what waits.
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  const std::string& label() const { return label_; }

  template <typename Work>
  std::invoke_result_t<Work> sync(Work&& work) {
    const Turn turn(*this);
    return std::forward<Work>(work)();
  }
  void async(std::function<void()> work);

  // Suspensions count: work runs again after as many calls of resume().
  void suspend();
  void resume();

  bool isCurrent() const;
  // Stops the process when the calling thread is not running work of this queue.
  void assertCurrent() const ASSERT_CAPABILITY(this);

 private:
  // One place in the line: `work` for the queue's own thread, none for a synchronous caller who is
  // waiting for his ticket to come up.
  struct Entry {
    uint64_t ticket;
    std::optional<std::function<void()>> work;
  };
  // The turn of one synchronous caller, from construction to destruction.
  class Turn {
   public:
    explicit Turn(SerialQueue& queue);
    ~Turn();
    Turn(const Turn&) = delete;
    Turn& operator=(const Turn&) = delete;

   private:
    SerialQueue& queue_;
    const SerialQueue* outer_;
  };

  bool mayStart(uint64_t ticket) const REQUIRES(mutex_);
  bool hasAsynchronousWorkReady() const REQUIRES(mutex_);
  void finish() EXCLUDES(mutex_);
  void runThread();

  const std::string label_;
  const QueuePriority priority_;
  Mutex mutex_;
  ConditionVariable changed_;
  std::deque<Entry> entries_ GUARDED_BY(mutex_);
  uint64_t nextTicket_ GUARDED_BY(mutex_) = 0;
  int suspensions_ GUARDED_BY(mutex_) = 0;
  bool running_ GUARDED_BY(mutex_) = false;
  bool ending_ GUARDED_BY(mutex_) = false;
  std::thread thread_ GUARDED_BY(mutex_);
};

}  // namespace platform
