// Follows the lock state of the device: while it is locked, the lock-state queue stands still.
#pragma once

#include "Platform/base/Mutex.h"
#include "Platform/base/SerialQueue.h"
#include "Platform/os/KeyBag.h"

class TSYLockStateFollower {
 public:
  TSYLockStateFollower(const platform::KeyBag& keyBag, platform::SerialQueue& lockStateQueue)
      : keyBag_(keyBag), lockStateQueue_(lockStateQueue) {}

  // Reads the state and suspends or resumes the queue when it has changed. Any other state than
  // locked and unlocked changes nothing. Any thread.
  void lockStateDidChange();

 private:
  // Neither locked nor unlocked: an unlocked device at start-up resumes nothing.
  static constexpr int kUnknownState = 3;

  const platform::KeyBag& keyBag_;
  platform::SerialQueue& lockStateQueue_;
  platform::Mutex mutex_;
  int rememberedState_ GUARDED_BY(mutex_) = kUnknownState;
};
