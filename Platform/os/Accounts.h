// The password and group databases: etc/passwd and etc/group under the root when they are there,
// else the system's. The files are read anew when they have changed. Any thread.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "Platform/fs/FileSystem.h"

namespace platform {

inline constexpr uid_t kInstallationAccount = 33;
inline constexpr uid_t kSystemAccount = 0;
inline constexpr uid_t kNobodyAccount = 4294967294U;
inline constexpr char kSystemUsersGroup[] = "systemusers";

struct Account {
  std::string name;
  uid_t uid;
  gid_t gid;
  std::string home;  // with the root in front
};

class Accounts {
 public:
  explicit Accounts(const FileSystem& files) : files_(files) {}

  std::optional<Account> accountNamed(const std::string& name) const;
  std::optional<Account> accountWithUID(uid_t uid) const;
  std::optional<gid_t> groupNamed(const std::string& name) const;

 private:
  const FileSystem& files_;
};

}  // namespace platform
