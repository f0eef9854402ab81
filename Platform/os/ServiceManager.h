// The service manager: readiness, watchdog and sockets handed over at start. Without one every
// operation does nothing.
#pragma once

#include <chrono>
#include <string>

#include "Platform/base/FileDescriptor.h"

namespace platform {

class ServiceManager {
 public:
  void notifyReady() const;
  void notifyStopping() const;
  // Asks for `time` more before the manager loses its patience.
  void extendTimeout(std::chrono::seconds time) const;
  // How often keepWatchdogQuiet() must be called; zero when there is no watchdog.
  std::chrono::microseconds watchdogInterval() const;
  void keepWatchdogQuiet() const;
  // The listening socket handed over under this name (LISTEN_FDNAMES); invalid when there is none.
  FileDescriptor takeSocket(const std::string& name) const;
};

}  // namespace platform
