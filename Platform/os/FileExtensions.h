// Tokens that give one process access to one path: "class;pid;path;hex", where hex authenticates
// class, audit token and path under the key of this boot, run/tessary/extension.key. Any thread.
#pragma once

#include <sodium.h>

#include <array>
#include <optional>
#include <string>

#include "Platform/base/Mutex.h"
#include "Platform/fs/FileSystem.h"
#include "Platform/os/AuditToken.h"

namespace platform {

class FileExtensions {
 public:
  explicit FileExtensions(const FileSystem& files) : files_(files) {}

  // EINVAL for a class or a path that a token cannot hold; else the errno of the key's file.
  Result<std::string> issue(const std::string& extensionClass, const std::string& path,
                            const AuditToken& process) const;
  bool verify(const std::string& token, const AuditToken& process) const;

 private:
  using Key = std::array<uint8_t, crypto_auth_KEYBYTES>;

  // Makes the key when this boot has none yet.
  Result<Key> key() const EXCLUDES(mutex_);

  const FileSystem& files_;
  mutable Mutex mutex_;
  mutable std::optional<Key> key_ GUARDED_BY(mutex_);
};

}  // namespace platform
