#include "Platform/os/KeyBag.h"

#include <limits>

#include "Platform/os/ConfigurationFile.h"
#include "Platform/os/RuntimeDirectory.h"

namespace platform {
namespace {

std::string path(const FileSystem& files) {
  return runtimeDirectory(files) + "/keybag";
}

}  // namespace

int KeyBag::lockState() const {
  const auto number = readNumberFile(files_, path(files_));
  if (!number || *number > std::numeric_limits<int>::max()) return kUnlocked;
  return static_cast<int>(*number);
}

Result<void> KeyBag::setLockState(int state) const {
  if (state < 0) return failWith(EINVAL);
  return writeNumberFile(files_, path(files_), static_cast<uint64_t>(state));
}

}  // namespace platform
