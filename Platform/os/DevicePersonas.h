// The personas of a real device: etc/tessary/personas.plist, followed while the process lives.
//
// Whether the device has personas is decided once, by whether the file is there at the start. From
// then on a good list replaces the one before; a file that is gone or malformed leaves a line in
// the system log and the last good list as it was. There is none yet when the file has been
// malformed from the start: such a device has personas, and nobody knows which.
#pragma once

#include "Platform/base/Mutex.h"
#include "Platform/fs/FileSystem.h"
#include "Platform/os/Personas.h"
#include "Platform/os/RunLoop.h"

namespace platform {

class DevicePersonas : public Personas {
 public:
  // Changes are noticed, and observers called, on `loop`, which ends first or runs no more when the
  // object goes.
  DevicePersonas(const FileSystem& files, RunLoop& loop);

  bool present() const override { return present_; }
  std::vector<PersonaAttributes> list() const override;
  std::optional<std::string> observe(const std::string& serviceName,
                                     std::function<void()> listDidUpdate) override;

 private:
  void follow(RunLoop& loop);
  // Reads the file. Whether the list is another one now.
  bool update() EXCLUDES(mutex_);
  void fileDidChange() EXCLUDES(mutex_);

  const FileSystem& files_;
  bool present_ = false;
  std::optional<std::string> followFailure_;
  mutable Mutex mutex_;
  std::vector<PersonaAttributes> list_ GUARDED_BY(mutex_);
  std::vector<std::function<void()>> observers_ GUARDED_BY(mutex_);
};

}  // namespace platform
