// The container-layout service: the subdirectories of each container class.
//
// A table of its own, which etc/tessary/container-layout.plist may override class by class (class
// number as a string to an array of relative paths). Read once. Any thread.
#pragma once

#include <cstdint>
#include <expected>
#include <map>
#include <string>
#include <vector>

#include "Platform/fs/FileSystem.h"

namespace platform {

class ContainerLayout {
 public:
  // The failure code for a class that the service does not know, or whose override holds a path
  // that is absolute, empty or climbs.
  static constexpr uint64_t kUnknownClass = 22;

  explicit ContainerLayout(const FileSystem& files);

  // Relative paths, parents before their children.
  std::expected<std::vector<std::string>, uint64_t> subdirectoriesOfClass(
      uint64_t containerClass) const;

 private:
  std::map<uint64_t, std::expected<std::vector<std::string>, uint64_t>> layouts_;
};

}  // namespace platform
