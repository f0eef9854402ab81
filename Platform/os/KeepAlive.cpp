#include "Platform/os/KeepAlive.h"

#include <utility>

namespace platform {

KeepAlive::Transaction::Transaction(KeepAlive& keepAlive) : keepAlive_(&keepAlive) {
  const MutexLock lock(keepAlive.mutex_);
  ++keepAlive.open_;
}

KeepAlive::Transaction::Transaction(Transaction&& other) noexcept
    : keepAlive_(std::exchange(other.keepAlive_, nullptr)) {}

KeepAlive::Transaction::~Transaction() {
  if (keepAlive_ == nullptr) return;
  const MutexLock lock(keepAlive_->mutex_);
  // Under the lock: the waiter may destroy the counter as soon as it has seen 0.
  if (--keepAlive_->open_ == 0) keepAlive_->idle_.notifyAll();
}

int KeepAlive::openTransactions() const {
  const MutexLock lock(mutex_);
  return open_;
}

bool KeepAlive::waitUntilIdle(std::chrono::milliseconds timeout) {
  using Clock = std::chrono::steady_clock;
  const auto deadline = Clock::now() + timeout;
  const MutexLock lock(mutex_);
  while (open_ > 0) {
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
    if (left.count() <= 0) return false;
    idle_.waitFor(mutex_, left);
  }
  return true;
}

}  // namespace platform
