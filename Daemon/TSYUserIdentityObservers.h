// Who is told when a user identity is no longer valid.
//
// Nobody is called under a lock. So that an observer can go while others are being told, whoever
// removes one waits for the call that another thread is making to it.
#pragma once

#include <set>
#include <thread>
#include <vector>

#include "Daemon/TSYUserIdentity.h"
#include "Platform/base/Mutex.h"

class TSYUserIdentityCacheObserver {
 public:
  virtual ~TSYUserIdentityCacheObserver() = default;
  // `identity` is no longer valid. Called without a lock of the cache.
  virtual void userIdentityCacheDidInvalidateUserIdentity(TSYUserIdentityCache& cache,
                                                          const TSYUserIdentityRef& identity) = 0;
};

class TSYUserIdentityObservers {
 public:
  void add(TSYUserIdentityCacheObserver& observer);
  // Once this returns `observer` is not called any more, but for the call that the calling thread
  // may be in.
  void remove(TSYUserIdentityCacheObserver& observer);
  // Calls every observer once for each identity.
  void tell(TSYUserIdentityCache& cache, const std::vector<TSYUserIdentityRef>& identities);

 private:
  struct Call {
    TSYUserIdentityCacheObserver* observer;
    std::thread::id thread;
    bool operator==(const Call&) const = default;
  };

  std::vector<TSYUserIdentityCacheObserver*> snapshot();
  // False when the observer has been removed meanwhile.
  bool beginCall(TSYUserIdentityCacheObserver* observer);
  void endCall(TSYUserIdentityCacheObserver* observer);
  bool isCalledElsewhere(TSYUserIdentityCacheObserver* observer) const REQUIRES(lock_);

  platform::Mutex lock_;
  platform::ConditionVariable callEnded_;
  std::set<TSYUserIdentityCacheObserver*> observers_ GUARDED_BY(lock_);
  std::vector<Call> calls_ GUARDED_BY(lock_);
};
