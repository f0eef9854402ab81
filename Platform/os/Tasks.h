// What is known of a running process beyond its user: its code-signing identifier, entitlements,
// sandbox and persona.
//
// The launcher leaves a record for each process under run/tessary/tasks, named by pid and start
// time. A record is believed only when it and its directory belong to the daemon's own user and
// nobody else can write them; a process without a believable record has no identity.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Platform/fs/FileSystem.h"
#include "Platform/os/AuditToken.h"
#include "Platform/values/Value.h"

namespace platform {

struct TaskRecord {
  std::optional<std::string> signingIdentifier;
  // None when the record has no entitlements or they are no dictionary.
  std::shared_ptr<const Value::Dictionary> entitlements;
  bool sandboxed = false;
  std::optional<std::string> personaUniqueString;
  bool kernelTask = false;
};

// A process as records are named by it.
struct TaskProcess {
  pid_t pid;
  uint64_t startTime;

  bool isAlive() const;
};

class Tasks {
 public:
  explicit Tasks(const FileSystem& files);

  // ENOENT without a record; EPERM for one that somebody else could have written; EINVAL for a
  // malformed one (logged). Any thread.
  Result<TaskRecord> record(pid_t pid, uint64_t startTime) const;
  // Writes the record of a process. Called by launchers.
  Result<void> write(pid_t pid, uint64_t startTime, const TaskRecord& record) const;
  // The processes that have a record, ended ones among them. None without a directory.
  Result<std::vector<TaskProcess>> processes() const;
  // Removes the records of processes that have ended.
  void removeStale() const;

 private:
  const FileSystem& files_;
};

}  // namespace platform
