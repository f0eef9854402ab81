#include "Daemon/TSYUserIdentityObservers.h"

#include <algorithm>

void TSYUserIdentityObservers::add(TSYUserIdentityCacheObserver& observer) {
  const platform::MutexLock lock(lock_);
  observers_.insert(&observer);
}

void TSYUserIdentityObservers::remove(TSYUserIdentityCacheObserver& observer) {
  const platform::MutexLock lock(lock_);
  observers_.erase(&observer);
  while (isCalledElsewhere(&observer)) callEnded_.wait(lock_);
}

void TSYUserIdentityObservers::tell(TSYUserIdentityCache& cache,
                                    const std::vector<TSYUserIdentityRef>& identities) {
  for (const TSYUserIdentityRef& identity : identities) {
    for (TSYUserIdentityCacheObserver* observer : snapshot()) {
      if (!beginCall(observer)) continue;
      observer->userIdentityCacheDidInvalidateUserIdentity(cache, identity);
      endCall(observer);
    }
  }
}

std::vector<TSYUserIdentityCacheObserver*> TSYUserIdentityObservers::snapshot() {
  const platform::MutexLock lock(lock_);
  return {observers_.begin(), observers_.end()};
}

bool TSYUserIdentityObservers::beginCall(TSYUserIdentityCacheObserver* observer) {
  const platform::MutexLock lock(lock_);
  if (!observers_.contains(observer)) return false;
  calls_.push_back({observer, std::this_thread::get_id()});
  return true;
}

void TSYUserIdentityObservers::endCall(TSYUserIdentityCacheObserver* observer) {
  {
    const platform::MutexLock lock(lock_);
    // One entry only: the thread may be in a call to the same observer that led to this one.
    calls_.erase(std::ranges::find(calls_, Call{observer, std::this_thread::get_id()}));
  }
  callEnded_.notifyAll();
}

bool TSYUserIdentityObservers::isCalledElsewhere(TSYUserIdentityCacheObserver* observer) const {
  return std::ranges::any_of(calls_, [&](const Call& call) {
    return call.observer == observer && call.thread != std::this_thread::get_id();
  });
}
