#include "Platform/base/SerialQueue.h"

#include <fmt/core.h>
#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdlib>
#include <utility>
#include <vector>

namespace platform {
namespace {

// The queues whose work the calling thread is running, innermost last: synchronous work of one
// queue may make a synchronous call on another.
thread_local const SerialQueue* currentQueue = nullptr;
thread_local std::vector<const SerialQueue*> outerQueues;

void lowerPriorityOfCallingThread() {
  constexpr int kWhoProcess = 1;       // IOPRIO_WHO_PROCESS
  constexpr int kIdleClass = 3 << 13;  // IOPRIO_CLASS_IDLE
  constexpr int kBackgroundNiceness = 10;
  const auto thread = static_cast<id_t>(::gettid());
  ::setpriority(PRIO_PROCESS, thread, kBackgroundNiceness);
  ::syscall(SYS_ioprio_set, kWhoProcess, 0, kIdleClass);
}

void nameCallingThread(const std::string& label) {
  constexpr size_t kLongestName = 15;  // the kernel's limit
  const size_t dot = label.rfind('.');
  const std::string name = dot == std::string::npos ? label : label.substr(dot + 1);
  ::pthread_setname_np(::pthread_self(), name.substr(0, kLongestName).c_str());
}

[[noreturn]] void stop(const std::string& label, const char* reason) {
  fmt::print(stderr, "queue {}: {}\n", label, reason);
  std::abort();
}

}  // namespace

SerialQueue::SerialQueue(std::string label, QueuePriority priority)
    : label_(std::move(label)), priority_(priority) {}

SerialQueue::~SerialQueue() {
  std::thread thread;
  {
    const MutexLock lock(mutex_);
    ending_ = true;
    thread = std::move(thread_);
  }
  changed_.notifyAll();
  if (thread.joinable()) thread.join();
}

void SerialQueue::async(std::function<void()> work) {
  {
    const MutexLock lock(mutex_);
    entries_.push_back({nextTicket_++, std::move(work)});
    // While the queue ends its thread is being waited for, and takes this work too.
    if (!thread_.joinable() && !ending_) thread_ = std::thread([this] { runThread(); });
  }
  changed_.notifyAll();
}

void SerialQueue::suspend() {
  const MutexLock lock(mutex_);
  ++suspensions_;
}

void SerialQueue::resume() {
  {
    const MutexLock lock(mutex_);
    if (suspensions_ == 0) stop(label_, "resumed more often than suspended");
    --suspensions_;
  }
  changed_.notifyAll();
}

bool SerialQueue::isCurrent() const {
  if (currentQueue == this) return true;
  for (const SerialQueue* outer : outerQueues) {
    if (outer == this) return true;
  }
  return false;
}

void SerialQueue::assertCurrent() const {
  if (!isCurrent()) stop(label_, "work that belongs on the queue runs outside it");
}

bool SerialQueue::mayStart(uint64_t ticket) const {
  return !running_ && suspensions_ == 0 && !entries_.empty() && entries_.front().ticket == ticket;
}

bool SerialQueue::hasAsynchronousWorkReady() const {
  return !entries_.empty() && entries_.front().work && mayStart(entries_.front().ticket);
}

void SerialQueue::finish() {
  bool someoneWaits = false;
  {
    const MutexLock lock(mutex_);
    running_ = false;
    someoneWaits = !entries_.empty() || ending_;
  }
  if (someoneWaits) changed_.notifyAll();
}

void SerialQueue::runThread() {
  nameCallingThread(label_);
  if (priority_ == QueuePriority::background) lowerPriorityOfCallingThread();
  for (;;) {
    std::function<void()> work;
    {
      const MutexLock lock(mutex_);
      while (!hasAsynchronousWorkReady()) {
        if (ending_ && (entries_.empty() || suspensions_ > 0)) return;
        changed_.wait(mutex_);
      }
      work = std::move(*entries_.front().work);
      entries_.pop_front();
      running_ = true;
    }
    currentQueue = this;
    work();
    work = nullptr;
    currentQueue = nullptr;
    finish();
  }
}

SerialQueue::Turn::Turn(SerialQueue& queue) : queue_(queue), outer_(currentQueue) {
  if (queue.isCurrent()) stop(queue.label_, "a synchronous call waits for itself");
  // From the turn on nothing may fail.
  outerQueues.reserve(outerQueues.size() + 1);
  {
    const MutexLock lock(queue.mutex_);
    const uint64_t ticket = queue.nextTicket_++;
    queue.entries_.push_back({ticket, std::nullopt});
    while (!queue.mayStart(ticket)) queue.changed_.wait(queue.mutex_);
    queue.entries_.pop_front();
    queue.running_ = true;
  }
  if (outer_ != nullptr) outerQueues.push_back(outer_);
  currentQueue = &queue;
}

SerialQueue::Turn::~Turn() {
  currentQueue = outer_;
  if (outer_ != nullptr) outerQueues.pop_back();
  queue_.finish();
}

}  // namespace platform
