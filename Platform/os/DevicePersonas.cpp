#include "Platform/os/DevicePersonas.h"

#include <fmt/format.h>

#include "Platform/os/ConfigurationFile.h"
#include "Platform/os/PersonaList.h"
#include "Platform/os/PlatformLog.h"
#include "Platform/os/RuntimeDirectory.h"

namespace platform {

DevicePersonas::DevicePersonas(const FileSystem& files, RunLoop& loop) : files_(files) {
  const auto status = files_.status(personaListPath(files_));
  present_ = status || status.error().value != ENOENT;
  if (!present_) return;
  // Followed first, so that no change falls between reading and following.
  follow(loop);
  update();
}

std::vector<PersonaAttributes> DevicePersonas::list() const {
  const MutexLock lock(mutex_);
  return list_;
}

std::optional<std::string> DevicePersonas::observe(const std::string& serviceName,
                                                   std::function<void()> listDidUpdate) {
  if (!present_) return fmt::format("{}: the device has no personas", serviceName);
  if (followFailure_) return fmt::format("{}: {}", serviceName, *followFailure_);
  const MutexLock lock(mutex_);
  observers_.push_back(std::move(listDidUpdate));
  return std::nullopt;
}

void DevicePersonas::follow(RunLoop& loop) {
  const std::string path = personaListPath(files_);
  const auto watched =
      loop.watchFile(configurationDirectory(files_), path.substr(path.rfind('/') + 1),
                     [this] { fileDidChange(); });
  if (!watched) {
    followFailure_ = fmt::format("{} cannot be followed: {}", path, watched.error().message());
    platformLog(LogLevel::error, "DevicePersonas::follow", "{}", *followFailure_);
  }
}

bool DevicePersonas::update() {
  const std::string path = personaListPath(files_);
  const auto value = readConfigurationFile(files_, path);
  if (!value) {
    platformLog(LogLevel::error, "DevicePersonas::update", "{}: {}; the last good list stays", path,
                value.error().message());
    return false;
  }
  auto list = parsePersonaList(*value, files_.root());
  if (!list) {
    platformLog(LogLevel::error, "DevicePersonas::update", "{}: {}; the last good list stays", path,
                list.error());
    return false;
  }
  const MutexLock lock(mutex_);
  if (*list == list_) return false;
  list_ = *std::move(list);
  return true;
}

void DevicePersonas::fileDidChange() {
  if (!update()) return;
  std::vector<std::function<void()>> observers;
  {
    const MutexLock lock(mutex_);
    observers = observers_;
  }
  for (const auto& listDidUpdate : observers) listDidUpdate();
}

}  // namespace platform
