#include "Daemon/TSYLockStateFollower.h"

#include "Daemon/TSYLog.h"

using platform::KeyBag;

void TSYLockStateFollower::lockStateDidChange() {
  const platform::MutexLock lock(mutex_);
  const int state = keyBag_.lockState();
  TSYLogWrite(TSYLogLevelDebug, "LockState={}", state);
  if (state == KeyBag::kLocked) {
    if (rememberedState_ != KeyBag::kLocked) lockStateQueue_.suspend();
    rememberedState_ = KeyBag::kLocked;
  } else if (state == KeyBag::kUnlocked) {
    if (rememberedState_ == KeyBag::kLocked) lockStateQueue_.resume();
    rememberedState_ = KeyBag::kUnlocked;
  }
}
