#include "Platform/base/Errno.h"

#include <array>

namespace platform {

std::string Errno::message() const {
  std::array<char, 256> buffer{};
  return strerror_r(value, buffer.data(), buffer.size());
}

}  // namespace platform
