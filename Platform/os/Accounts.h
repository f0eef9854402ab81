// The password and group databases: etc/passwd and etc/group under the root when they are there,
// else the system's. The files are read anew when they have changed. Any thread.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

#include "Platform/base/Mutex.h"
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

struct Group {
  std::string name;
  gid_t gid;
  std::vector<std::string> members;
};

class Accounts {
 public:
  explicit Accounts(const FileSystem& files) : files_(files) {}

  std::optional<Account> accountNamed(const std::string& name) const;
  std::optional<Account> accountWithUID(uid_t uid) const;
  std::optional<gid_t> groupNamed(const std::string& name) const;
  // The account's own group and every other one that names it as a member. For launchers.
  std::vector<gid_t> groupsOfAccount(const Account& account) const;

 private:
  // What tells one state of a file from the next.
  struct Stamp {
    Stamp() = default;
    explicit Stamp(const struct stat& status)
        : modified(status.st_mtim.tv_sec),
          nanoseconds(status.st_mtim.tv_nsec),
          size(status.st_size),
          inode(status.st_ino) {}
    bool operator==(const Stamp&) const = default;

    time_t modified = -1;
    long nanoseconds = 0;
    off_t size = 0;
    ino_t inode = 0;
  };
  // A file's entries in its order: of two for one name the first counts.
  template <typename Entry>
  struct Database {
    Stamp stamp;
    Stamp unreadable;  // the state that is in the log as unreadable
    std::vector<Entry> entries;
  };

  // The entries of a file as it is now; none when it is not there and the system's count.
  template <typename Entry, typename FromLine>
  const std::vector<Entry>* refresh(Database<Entry>& database, const char* name,
                                    const FromLine& fromLine) const REQUIRES(mutex_);
  const std::vector<Account>* accounts() const REQUIRES(mutex_);
  const std::vector<Group>* groups() const REQUIRES(mutex_);

  const FileSystem& files_;
  mutable Mutex mutex_;
  mutable Database<Account> accounts_ GUARDED_BY(mutex_);
  mutable Database<Group> groups_ GUARDED_BY(mutex_);
};

}  // namespace platform
