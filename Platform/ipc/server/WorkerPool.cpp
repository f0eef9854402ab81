#include "Platform/ipc/server/WorkerPool.h"

#include <fmt/format.h>
#include <pthread.h>
#include <sys/eventfd.h>

#include <memory>
#include <system_error>

namespace platform::ipc {
namespace {

constexpr size_t kScratchSize = 64 * 1024;

}  // namespace

WorkerPool::WorkerPool(unsigned maximumWorkers, const SystemLog& log, EventHandler handler)
    : maximumWorkers_(maximumWorkers), log_(log), handler_(std::move(handler)) {}

WorkerPool::~WorkerPool() {
  stop();
}

Result<void> WorkerPool::open() {
  epoll_ = FileDescriptor(::epoll_create1(EPOLL_CLOEXEC));
  if (!epoll_.valid()) return lastErrno();
  stopEvent_ = FileDescriptor(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!stopEvent_.valid()) return lastErrno();
  // Not for one event only: it is never read, so that it wakes every worker.
  epoll_event event = {.events = EPOLLIN, .data = {.u64 = kStopToken}};
  if (::epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, stopEvent_.get(), &event) != 0) return lastErrno();
  return {};
}

void WorkerPool::start() {
  startWorker();
}

void WorkerPool::stop() {
  std::vector<std::thread> workers;
  {
    const MutexLock lock(mutex_);
    stopping_ = true;
    workers.swap(workers_);
  }
  if (stopEvent_.valid()) ::eventfd_write(stopEvent_.get(), 1);
  for (std::thread& worker : workers) worker.join();
}

Result<void> WorkerPool::add(int descriptor, uint64_t token, uint32_t events) {
  epoll_event event = {.events = events | EPOLLONESHOT, .data = {.u64 = token}};
  if (::epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, descriptor, &event) != 0) return lastErrno();
  return {};
}

void WorkerPool::arm(int descriptor, uint64_t token, uint32_t events) {
  epoll_event event = {.events = events | EPOLLONESHOT, .data = {.u64 = token}};
  ::epoll_ctl(epoll_.get(), EPOLL_CTL_MOD, descriptor, &event);
}

void WorkerPool::remove(int descriptor) {
  ::epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, descriptor, nullptr);
}

void WorkerPool::startWorker() {
  const MutexLock lock(mutex_);
  if (stopping_ || workers_.size() >= maximumWorkers_) return;
  try {
    ++free_;
    workers_.emplace_back([this] { run(); });
  } catch (const std::system_error& error) {
    --free_;
    log_.write(LogLevel::error, "relay", __func__, 0,
               fmt::format("no worker thread more than {}: {}", workers_.size(), error.what()));
  }
}

void WorkerPool::run() {
  ::pthread_setname_np(::pthread_self(), "relay worker");
  const auto scratch = std::make_unique_for_overwrite<uint8_t[]>(kScratchSize);
  for (;;) {
    epoll_event event{};
    if (::epoll_wait(epoll_.get(), &event, 1, -1) != 1) continue;  // interrupted
    if (event.data.u64 == kStopToken) return;
    if (free_.fetch_sub(1) == 1) startWorker();
    handler_(event.data.u64, {scratch.get(), kScratchSize});
    ++free_;
  }
}

}  // namespace platform::ipc
