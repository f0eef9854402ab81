// Kills a device's daemon when it is not called off in time, so that a request that would wait for
// ever fails instead: the connection breaks under it.
#pragma once

#include <gtest/gtest.h>
#include <signal.h>

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <thread>

#include "Tests/Integration/Device.h"
#include "Tests/Integration/SanitizedBuild.h"

class Watchdog {
 public:
  static constexpr std::chrono::seconds kPatience{kSanitizedStride > 1 ? 100 : 20};

  explicit Watchdog(const Device& device)
      : daemon_(device.daemonPid()), thread_([this] { watch(); }) {}
  ~Watchdog() {
    {
      const std::scoped_lock lock(mutex_);
      isCalledOff_ = true;
    }
    changed_.notify_all();
    thread_.join();
  }
  Watchdog(const Watchdog&) = delete;
  Watchdog& operator=(const Watchdog&) = delete;

 private:
  void watch() {
    std::unique_lock lock(mutex_);
    if (changed_.wait_for(lock, kPatience, [this] { return isCalledOff_; })) return;
    ADD_FAILURE() << "the daemon hangs: " << kPatience.count() << " s without an end";
    ::kill(daemon_, SIGKILL);
  }

  const pid_t daemon_;
  std::mutex mutex_;
  std::condition_variable changed_;
  bool isCalledOff_ = false;
  std::thread thread_;
};
