// Whole reads and writes on a descriptor that the caller has opened and looked at, and the bytes of
// a file as text. Any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>
#include <vector>

#include "Platform/base/Errno.h"

namespace platform {

// From the descriptor's position to the end. EFBIG when more than `limit` bytes are there.
Result<std::vector<uint8_t>> readToEnd(int descriptor, size_t limit);
Result<void> writeAll(int descriptor, std::string_view bytes);

inline std::string_view asText(const std::vector<uint8_t>& bytes) {
  return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
}
inline std::span<const uint8_t> asBytes(std::string_view text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

}  // namespace platform
