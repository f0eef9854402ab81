// Kills a device's daemon when it is not called off in time, so that a request that would wait for
// ever fails instead: the connection breaks under it.
#pragma once

#include <gtest/gtest.h>
#include <signal.h>

#include <condition_variable>
#include <thread>

#include "Tests/Integration/Device.h"
#include "Tests/Integration/SanitizedBuild.h"

class Watchdog {
 public:
  explicit Watchdog(const Device& device)
      : thread_([daemon = device.daemonPid()](const std::stop_token& calledOff) {
          constexpr std::chrono::seconds kPatience{kSanitizedStride > 1 ? 100 : 20};
          std::mutex mutex;
          std::unique_lock lock(mutex);
          std::condition_variable_any().wait_for(lock, calledOff, kPatience, [] { return false; });
          if (calledOff.stop_requested()) return;
          ADD_FAILURE() << "the daemon hangs: " << kPatience.count() << " s without an end";
          ::kill(daemon, SIGKILL);
        }) {}

 private:
  std::jthread thread_;
};
