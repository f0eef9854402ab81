// The device's lock state, one decimal number in run/tessary/keybag. Any thread.
#pragma once

#include "Platform/fs/FileSystem.h"

namespace platform {

class KeyBag {
 public:
  static constexpr int kUnlocked = 0;
  static constexpr int kLocked = 1;

  explicit KeyBag(const FileSystem& files) : files_(files) {}

  // Without a file the device is unlocked.
  int lockState() const;
  // Writes the state. The caller posts the lock-status notification.
  Result<void> setLockState(int state) const;

 private:
  const FileSystem& files_;
};

}  // namespace platform
