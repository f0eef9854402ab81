// What FileSystem passes over without root's rights. Any thread.
#pragma once

#include <sys/stat.h>

#include "Platform/fs/FileSystem.h"

namespace platform {

// Mode 0 keeps everybody out but root.
inline mode_t appliedMode(mode_t mode, Privilege privilege) {
  return privilege == Privilege::none && mode == 0 ? S_IRWXU : mode;
}

// The result of a change of owner that has just returned `outcome`.
inline Result<void> ownerChanged(int outcome, Privilege privilege) {
  if (outcome == 0 || (errno == EPERM && privilege == Privilege::none)) return {};
  return lastErrno();
}

}  // namespace platform
