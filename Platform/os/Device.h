// What the device is configured with: etc/tessary/device.plist, read once. Any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "Platform/fs/FileSystem.h"
#include "Platform/values/Value.h"

namespace platform {

class Device {
 public:
  explicit Device(const FileSystem& files);

  // The host's multi-user configuration flags; none when the query fails.
  std::optional<uint32_t> multiUserFlags() const;
  // The top bit of the flags: several users share the device.
  bool isMultiUser() const { return (multiUserFlags().value_or(0) & 0x80000000U) != 0; }
  bool personasRuledOut() const;
  bool usesEphemeralStorage() const;
  bool featureEnabled(std::string_view domain, std::string_view name) const;

 private:
  Value::Dictionary settings_;
};

}  // namespace platform
