// The operating system's version, from etc/os-release under the root. Read once. Any thread.
#pragma once

#include "Platform/fs/FileSystem.h"
#include "Platform/values/Value.h"

namespace platform {

class SystemVersion {
 public:
  explicit SystemVersion(const FileSystem& files);

  // "ProductName", "ProductVersion", "ProductBuildVersion", "ReleaseType": those that are known.
  const Value::Dictionary& dictionary() const { return dictionary_; }
  bool isInternalBuild() const { return internal_; }

 private:
  Value::Dictionary dictionary_;
  bool internal_ = false;
};

}  // namespace platform
