#include "Platform/os/KeepAlive.h"

#include <utility>

namespace platform {

KeepAlive::Transaction::Transaction(KeepAlive& keepAlive, std::string name)
    : keepAlive_(&keepAlive) {
  const MutexLock lock(keepAlive.mutex_);
  place_ = keepAlive.open_.insert(std::move(name));
}

KeepAlive::Transaction::Transaction(Transaction&& other) noexcept
    : keepAlive_(std::exchange(other.keepAlive_, nullptr)), place_(other.place_) {}

KeepAlive::Transaction::~Transaction() {
  if (keepAlive_ == nullptr) return;
  const MutexLock lock(keepAlive_->mutex_);
  // Under the lock: the waiter may destroy the object as soon as it has seen that none is open.
  keepAlive_->open_.erase(place_);
  if (keepAlive_->open_.empty()) keepAlive_->idle_.notifyAll();
}

std::vector<std::string> KeepAlive::openTransactions() const {
  const MutexLock lock(mutex_);
  return {open_.begin(), open_.end()};
}

bool KeepAlive::waitUntilIdle(std::chrono::milliseconds timeout) {
  using Clock = std::chrono::steady_clock;
  const auto deadline = Clock::now() + timeout;
  const MutexLock lock(mutex_);
  while (!open_.empty()) {
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
    if (left.count() <= 0) return false;
    idle_.waitFor(mutex_, left);
  }
  return true;
}

}  // namespace platform
