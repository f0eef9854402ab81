// Bytes as they stand in tables: hexadecimal digits, with spaces where it helps the eye.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace platform::ipc {

inline std::vector<uint8_t> hexBytes(std::string_view text) {
  std::string digits;
  for (const char character : text) {
    if (character != ' ') digits += character;
  }
  std::vector<uint8_t> bytes;
  for (size_t index = 0; index + 1 < digits.size(); index += 2) {
    bytes.push_back(static_cast<uint8_t>(std::stoul(digits.substr(index, 2), nullptr, 16)));
  }
  return bytes;
}

}  // namespace platform::ipc
