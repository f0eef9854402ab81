#include "Platform/fs/RandomName.h"

#include <sys/random.h>

#include <cstdint>
#include <string_view>
#include <vector>

namespace platform {

Result<std::string> randomName(std::string prefix, size_t characters) {
  constexpr std::string_view kAlphabet =
      "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";
  std::vector<uint8_t> bytes(characters);
  if (::getrandom(bytes.data(), bytes.size(), 0) != static_cast<ssize_t>(bytes.size())) {
    return lastErrno();
  }
  for (const uint8_t byte : bytes) prefix += kAlphabet[byte % kAlphabet.size()];
  return prefix;
}

Result<std::string> temporarySiblingName() {
  return randomName(kTemporaryPrefix, 16);
}

}  // namespace platform
