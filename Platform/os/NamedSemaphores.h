// Named semaphores, as far as the daemon uses them: they exist or not until the next boot.
// A file each in run/tessary/semaphores. Any thread.
#pragma once

#include <string>

#include "Platform/fs/FileSystem.h"

namespace platform {

class NamedSemaphores {
 public:
  explicit NamedSemaphores(const FileSystem& files) : files_(files) {}

  bool exists(const std::string& name) const;
  // EEXIST when it is there already.
  Result<void> create(const std::string& name, mode_t mode) const;

 private:
  const FileSystem& files_;
};

}  // namespace platform
