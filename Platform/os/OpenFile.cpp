#include "Platform/os/OpenFile.h"

#include <unistd.h>

#include <algorithm>

namespace platform {

Result<std::vector<uint8_t>> readToEnd(int descriptor, size_t limit) {
  constexpr size_t kStep = 4096;
  std::vector<uint8_t> bytes;
  size_t length = 0;
  for (;;) {
    bytes.resize(std::max(length + kStep, length * 2));
    const ssize_t count = ::read(descriptor, bytes.data() + length, bytes.size() - length);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return lastErrno();
    length += static_cast<size_t>(count);
    if (length > limit) return failWith(EFBIG);
    if (count == 0) break;
  }
  bytes.resize(length);
  return bytes;
}

Result<void> writeAll(int descriptor, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t count = ::write(descriptor, bytes.data(), bytes.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return lastErrno();
    bytes.remove_prefix(static_cast<size_t>(count));
  }
  return {};
}

}  // namespace platform
