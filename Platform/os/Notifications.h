// System notifications, posted and observed by name: a counter in run/tessary/notifications/NAME.
#pragma once

#include <cstdint>
#include <functional>
#include <string>

#include "Platform/fs/FileSystem.h"
#include "Platform/os/RunLoop.h"

namespace platform {

namespace notification {
inline constexpr char kCleanupComplete[] = "com.veltra.tessary.cleanup-complete";
inline constexpr char kRebootCleanupComplete[] = "com.veltra.tessary.reboot-cleanup-complete";
inline constexpr char kUserInvalidated[] = "com.veltra.tessary.user-invalidated";
inline constexpr char kLockStatus[] = "com.veltra.keybag.lock-status";
}  // namespace notification

class Notifications {
 public:
  static constexpr uint32_t kStatusOK = 0;

  // `loop` delivers what is observed; a process that only posts passes none.
  Notifications(const FileSystem& files, RunLoop* loop) : files_(files), loop_(loop) {}

  // Adds one to the name's counter. Returns kStatusOK, else the errno. Any thread.
  uint32_t post(const std::string& name) const;
  // Calls `handler` on the main thread after each post. Returns kStatusOK, else the errno.
  uint32_t observe(const std::string& name, std::function<void()> handler) const;

 private:
  const FileSystem& files_;
  RunLoop* loop_;
};

}  // namespace platform
