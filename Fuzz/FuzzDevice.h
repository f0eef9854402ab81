// One scratch device for all inputs of a fuzz target: real services on a directory in memory, with
// the user "mobile" (501). It goes with the process.
#pragma once

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "Platform/os/Platform.h"
#include "Tests/ScratchDirectory.h"

class FuzzDevice {
 public:
  FuzzDevice() {
    ::setenv("TESSARY_LOG_LEVEL", "fault", 1);  // every rejection is logged
    // In memory where that is possible: what takes the time is making files.
    root_ = makeScratchDirectory(::access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp");
    std::filesystem::create_directories(root_ + "/etc");
    std::ofstream(root_ + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
    auto device = platform::DevicePlatform::open(root_);
    if (!device) std::abort();
    device_ = std::move(*device);
    platform::Platform::setCurrent(device_->platform());
  }
  ~FuzzDevice() { std::filesystem::remove_all(root_); }
  FuzzDevice(const FuzzDevice&) = delete;
  FuzzDevice& operator=(const FuzzDevice&) = delete;

  const std::string& root() const { return root_; }
  platform::FileSystem& files() const { return device_->platform().files; }

 private:
  std::string root_;
  std::unique_ptr<platform::DevicePlatform> device_;
};
