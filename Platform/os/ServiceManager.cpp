#include "Platform/os/ServiceManager.h"

#include <fmt/format.h>
#include <sys/socket.h>
#include <systemd/sd-daemon.h>

#include <cstdlib>

#include "Platform/base/Errno.h"
#include "Platform/os/PlatformLog.h"

namespace platform {
namespace {

void notify(const char* state) {
  const int result = ::sd_notify(/*unset_environment=*/0, state);
  if (result < 0) {
    platformLog(LogLevel::error, "ServiceManager::notify", "{}: {}", state,
                Errno{-result}.message());
  }
}

}  // namespace

void ServiceManager::notifyReady() const {
  notify("READY=1");
}

void ServiceManager::notifyStopping() const {
  notify("STOPPING=1");
}

void ServiceManager::extendTimeout(std::chrono::seconds time) const {
  const std::chrono::microseconds microseconds = time;
  notify(fmt::format("EXTEND_TIMEOUT_USEC={}", microseconds.count()).c_str());
}

std::chrono::microseconds ServiceManager::watchdogInterval() const {
  uint64_t timeout = 0;
  if (::sd_watchdog_enabled(/*unset_environment=*/0, &timeout) <= 0) return {};
  return std::chrono::microseconds(timeout / 2);  // half, as the manager advises
}

void ServiceManager::keepWatchdogQuiet() const {
  notify("WATCHDOG=1");
}

FileDescriptor ServiceManager::takeSocket(const std::string& name) const {
  char** names = nullptr;
  const int count = ::sd_listen_fds_with_names(/*unset_environment=*/0, &names);
  FileDescriptor socket;
  for (int i = 0; i < count; ++i) {
    const int descriptor = SD_LISTEN_FDS_START + i;
    const bool isWanted = name == names[i];
    ::free(names[i]);
    if (!isWanted || socket.valid()) continue;
    if (::sd_is_socket(descriptor, AF_UNIX, /*type=*/0, /*listening=*/1) > 0) {
      socket = FileDescriptor(descriptor);
    } else {
      platformLog(LogLevel::error, "ServiceManager::takeSocket",
                  "what was handed over as {} is no listening socket", name);
    }
  }
  ::free(static_cast<void*>(names));
  return socket;
}

}  // namespace platform
