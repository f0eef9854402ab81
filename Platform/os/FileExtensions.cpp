#include "Platform/os/FileExtensions.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <string_view>
#include <vector>

#include "Platform/os/OpenFile.h"
#include "Platform/os/PlatformLog.h"
#include "Platform/os/RuntimeDirectory.h"

namespace platform {
namespace {

constexpr mode_t kKeyMode = 0600;
using Authenticator = std::array<unsigned char, crypto_auth_BYTES>;

std::string keyPath(const FileSystem& files) {
  return runtimeDirectory(files) + "/extension.key";
}

// What is authenticated. The class's length comes first, so that no other split into class and
// path gives the same bytes.
std::vector<unsigned char> statement(std::string_view extensionClass, std::string_view path,
                                     const AuditToken& process) {
  std::vector<unsigned char> bytes;
  for (int shift = 0; shift < 32; shift += 8) {
    bytes.push_back(static_cast<unsigned char>(extensionClass.size() >> shift));
  }
  const auto token = process.bytes();
  bytes.insert(bytes.end(), extensionClass.begin(), extensionClass.end());
  bytes.insert(bytes.end(), token.begin(), token.end());
  bytes.insert(bytes.end(), path.begin(), path.end());
  return bytes;
}

// ENOENT without a file; EPERM for a key that others could know or have written, EINVAL for one of
// another size.
template <typename Key>
Result<Key> readKey(const FileSystem& files) {
  const auto file = files.openItem(keyPath(files));
  if (!file) return std::unexpected(file.error());
  struct stat status{};
  if (::fstat(file->get(), &status) != 0) return lastErrno();
  const bool isPrivate = S_ISREG(status.st_mode) && status.st_uid == ::geteuid() &&
                         (status.st_mode & (S_IRWXG | S_IRWXO)) == 0;
  if (!isPrivate) return failWith(EPERM);
  Key key{};
  const auto bytes = readToEnd(file->get(), key.size());
  if (!bytes || bytes->size() != key.size()) return failWith(EINVAL);
  std::copy(bytes->begin(), bytes->end(), key.begin());
  return key;
}

}  // namespace

Result<FileExtensions::Key> FileExtensions::key() const {
  const MutexLock lock(mutex_);
  if (key_) return *key_;
  // Two processes that both find none agree on one.
  const auto directoryLock = lockRuntimeDirectory(files_);
  if (!directoryLock) return std::unexpected(directoryLock.error());
  auto stored = readKey<Key>(files_);
  if (!stored) {
    if (stored.error().value != ENOENT) {
      platformLog(LogLevel::error, "FileExtensions::key", "{} is not used, a new one is made: {}",
                  keyPath(files_), stored.error().message());
    }
    stored.emplace();
    randombytes_buf(stored->data(), stored->size());
    const auto written =
        files_.writeFile(keyPath(files_), *stored, {.mode = kKeyMode, .atomic = true});
    if (!written) return std::unexpected(written.error());
  }
  key_ = *stored;
  return *key_;
}

Result<std::string> FileExtensions::issue(const std::string& extensionClass,
                                          const std::string& path,
                                          const AuditToken& process) const {
  const bool fits = !extensionClass.empty() && !path.empty() &&
                    extensionClass.find_first_of(std::string_view(";\0", 2)) == std::string::npos &&
                    path.find('\0') == std::string::npos;
  if (!fits) return failWith(EINVAL);
  const auto secret = key();
  if (!secret) return std::unexpected(secret.error());
  const auto message = statement(extensionClass, path, process);
  Authenticator authenticator{};
  crypto_auth(authenticator.data(), message.data(), message.size(), secret->data());
  return fmt::format("{};{};{};{:02x}", extensionClass, process.pid(), path,
                     fmt::join(authenticator, ""));
}

bool FileExtensions::verify(const std::string& token, const AuditToken& process) const {
  const size_t classEnd = token.find(';');
  const size_t pidEnd = token.find(';', classEnd + 1);
  const size_t pathEnd = token.rfind(';');
  // Each of the three must be there, and the path between the last two.
  if (classEnd == std::string::npos || pidEnd == std::string::npos || pathEnd <= pidEnd) {
    return false;
  }
  const std::string_view text = token;
  const std::string_view pid = text.substr(classEnd + 1, pidEnd - classEnd - 1);
  const std::string_view hex = text.substr(pathEnd + 1);
  Authenticator authenticator{};
  size_t length = 0;
  const char* end = nullptr;
  const bool isHex = ::sodium_hex2bin(authenticator.data(), authenticator.size(), hex.data(),
                                      hex.size(), nullptr, &length, &end) == 0 &&
                     length == authenticator.size() && end == hex.data() + hex.size();
  if (!isHex || pid != std::to_string(process.pid())) return false;
  const auto secret = key();
  if (!secret) return false;
  const auto message =
      statement(text.substr(0, classEnd), text.substr(pidEnd + 1, pathEnd - pidEnd - 1), process);
  return crypto_auth_verify(authenticator.data(), message.data(), message.size(), secret->data()) ==
         0;
}

}  // namespace platform
