#include "Platform/os/NamedSemaphores.h"

#include <fcntl.h>

#include "Platform/os/RuntimeDirectory.h"

namespace platform {
namespace {

std::string directory(const FileSystem& files) {
  return runtimeDirectory(files) + "/semaphores";
}

}  // namespace

bool NamedSemaphores::exists(const std::string& name) const {
  return files_.status(directory(files_) + "/" + fileNameForIdentifier(name)).has_value();
}

Result<void> NamedSemaphores::create(const std::string& name, mode_t mode) const {
  if (const auto made = files_.makePath(directory(files_), 0755); !made) return made;
  const auto place = files_.locate(directory(files_) + "/" + fileNameForIdentifier(name));
  if (!place) return std::unexpected(place.error());
  constexpr int kFlags = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
  const FileDescriptor file(::openat(place->parent.get(), place->name.c_str(), kFlags, mode));
  if (!file.valid()) return lastErrno();
  return {};
}

}  // namespace platform
