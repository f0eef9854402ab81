// The identity of a process as the kernel vouches for it: eight 32-bit numbers, 32 bytes.
#pragma once

#include <sys/types.h>

#include <array>
#include <cstdint>

#include "Platform/base/Errno.h"

namespace platform {

struct AuditToken {
  // euid, egid, euid, egid, 0, pid, start time low, start time high. The start time (clock ticks
  // since boot) tells a process from a later one with the same pid.
  std::array<uint32_t, 8> words{};

  uid_t effectiveUID() const { return words[0]; }
  gid_t effectiveGID() const { return words[1]; }
  pid_t pid() const { return static_cast<pid_t>(words[5]); }
  uint64_t startTime() const { return words[6] | static_cast<uint64_t>(words[7]) << 32; }
  // The 32 bytes, little-endian.
  std::array<uint8_t, 32> bytes() const;

  static AuditToken make(uid_t uid, gid_t gid, pid_t pid, uint64_t startTime);
  bool operator==(const AuditToken&) const = default;
};

// Field 22 of /proc/PID/stat. ESRCH when there is no such process.
Result<uint64_t> processStartTime(pid_t pid);

}  // namespace platform
