#include "Platform/os/Notifications.h"

#include "Platform/os/ConfigurationFile.h"
#include "Platform/os/RuntimeDirectory.h"

namespace platform {
namespace {

std::string directory(const FileSystem& files) {
  return runtimeDirectory(files) + "/notifications";
}

Result<void> post(const FileSystem& files, const std::string& name) {
  if (const auto made = files.makePath(directory(files), 0755); !made) return made;
  const std::string path = directory(files) + "/" + fileNameForIdentifier(name);
  // Posts of two processes count as two.
  const auto lock = lockRuntimeDirectory(files);
  if (!lock) return std::unexpected(lock.error());
  const uint64_t count = readNumberFile(files, path).value_or(0);
  return writeNumberFile(files, path, count + 1);
}

uint32_t statusOf(const Result<void>& result) {
  return result ? Notifications::kStatusOK : static_cast<uint32_t>(result.error().value);
}

}  // namespace

uint32_t Notifications::post(const std::string& name) const {
  return statusOf(platform::post(files_, name));
}

uint32_t Notifications::observe(const std::string& name, std::function<void()> handler) const {
  if (loop_ == nullptr) return ENOTSUP;
  if (const auto made = files_.makePath(directory(files_), 0755); !made) return statusOf(made);
  return statusOf(
      loop_->watchFile(directory(files_), fileNameForIdentifier(name), std::move(handler)));
}

}  // namespace platform
