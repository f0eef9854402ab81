// A 128-bit universally unique identifier.
#pragma once

#include <array>
#include <compare>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

class UUID {
 public:
  using Bytes = std::array<uint8_t, 16>;

  explicit UUID(const Bytes& bytes) : bytes_(bytes) {}

  // A new random one (version 4).
  static UUID random();
  // Reads the 36-character text form, in either case. Nothing else is a UUID.
  static std::optional<UUID> parse(std::string_view text);

  const Bytes& bytes() const { return bytes_; }
  // The canonical text form, in upper case.
  std::string string() const;

  auto operator<=>(const UUID&) const = default;

 private:
  Bytes bytes_;
};

}  // namespace platform

template <>
struct std::hash<platform::UUID> {
  size_t operator()(const platform::UUID& uuid) const noexcept;
};
