#include "Platform/os/Tasks.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <charconv>
#include <string_view>

#include "Platform/os/OpenFile.h"
#include "Platform/os/PlatformLog.h"
#include "Platform/os/RuntimeDirectory.h"
#include "Platform/values/PropertyList.h"

namespace platform {
namespace {

constexpr char kSigningIdentifier[] = "SigningIdentifier";
constexpr char kEntitlements[] = "Entitlements";
constexpr char kSandboxed[] = "Sandboxed";
constexpr char kPersonaUniqueString[] = "PersonaUniqueString";
constexpr char kKernelTask[] = "KernelTask";
constexpr mode_t kDirectoryMode = 0700;
constexpr mode_t kRecordMode = 0600;

std::string tasksDirectory(const FileSystem& files) {
  return runtimeDirectory(files) + "/tasks";
}

std::string recordPath(const FileSystem& files, pid_t pid, uint64_t startTime) {
  return fmt::format("{}/{}.{}.plist", tasksDirectory(files), pid, startTime);
}

// Only the daemon's own user could have put it there. A POSIX ACL cannot hide a writer: its mask
// shows in the bits of the group.
bool isOwn(const struct stat& status) {
  return status.st_uid == ::geteuid() && (status.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

// Opens a record that may be believed. What is checked is the open file and the open directory, so
// that nothing can be exchanged after the check.
Result<FileDescriptor> openOwnRecord(const FileSystem& files, const std::string& path) {
  const auto place = files.locate(path);
  if (!place) return std::unexpected(place.error());
  struct stat status{};
  if (::fstat(place->parent.get(), &status) != 0) return lastErrno();
  if (!isOwn(status)) return failWith(EPERM);
  constexpr int kFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
  FileDescriptor file(::openat(place->parent.get(), place->name.c_str(), kFlags));
  if (!file.valid()) return failWith(errno == ELOOP ? EPERM : errno);
  if (::fstat(file.get(), &status) != 0) return lastErrno();
  if (!S_ISREG(status.st_mode) || !isOwn(status)) return failWith(EPERM);
  return file;
}

// Reads `key` as a T. A key that is there with another type makes the record malformed.
template <typename T>
bool readKey(const Value& record, const char* key, const T* (Value::*accessor)() const,
             const std::function<void(const T&)>& store) {
  const Value* value = record.find(key);
  if (value == nullptr) return true;
  const T* content = (value->*accessor)();
  if (content != nullptr) store(*content);
  return content != nullptr;
}

std::optional<TaskRecord> recordFromValue(const Value& value) {
  if (value.asDictionary() == nullptr) return std::nullopt;
  TaskRecord record;
  const bool wellFormed =
      readKey<std::string>(value, kSigningIdentifier, &Value::asString,
                           [&](const auto& text) { record.signingIdentifier = text; }) &&
      readKey<bool>(value, kSandboxed, &Value::asBool,
                    [&](bool sandboxed) { record.sandboxed = sandboxed; }) &&
      readKey<std::string>(value, kPersonaUniqueString, &Value::asString,
                           [&](const auto& text) { record.personaUniqueString = text; }) &&
      readKey<bool>(value, kKernelTask, &Value::asBool,
                    [&](bool kernelTask) { record.kernelTask = kernelTask; });
  if (!wellFormed) return std::nullopt;
  const Value* entitlements = value.find(kEntitlements);
  if (entitlements != nullptr && entitlements->asDictionary() != nullptr) {
    record.entitlements = std::make_shared<const Value::Dictionary>(*entitlements->asDictionary());
  }
  return record;
}

Value valueFromRecord(const TaskRecord& record) {
  Value::Dictionary value;
  if (record.signingIdentifier) value[kSigningIdentifier] = *record.signingIdentifier;
  if (record.entitlements) value[kEntitlements] = *record.entitlements;
  value[kSandboxed] = record.sandboxed;
  if (record.personaUniqueString) value[kPersonaUniqueString] = *record.personaUniqueString;
  if (record.kernelTask) value[kKernelTask] = true;
  return value;
}

std::optional<TaskProcess> processFromRecordName(std::string_view name) {
  const char* const end = name.data() + name.size();
  TaskProcess process{};
  const auto pid = std::from_chars(name.data(), end, process.pid);
  if (pid.ec != std::errc() || process.pid <= 0 || pid.ptr == end || *pid.ptr != '.') {
    return std::nullopt;
  }
  const auto time = std::from_chars(pid.ptr + 1, end, process.startTime);
  if (time.ec != std::errc() || std::string_view(time.ptr, end) != ".plist") return std::nullopt;
  return process;
}

}  // namespace

Tasks::Tasks(const FileSystem& files) : files_(files) {}

Result<TaskRecord> Tasks::record(pid_t pid, uint64_t startTime) const {
  const std::string path = recordPath(files_, pid, startTime);
  const auto file = openOwnRecord(files_, path);
  if (!file) {
    if (file.error().value == EPERM) {
      platformLog(LogLevel::error, "Tasks::record", "{} is not believed: others could write it",
                  path);
    }
    return std::unexpected(file.error());
  }
  const auto bytes = readToEnd(file->get(), PropertyListLimits::kBytes);
  if (!bytes) return std::unexpected(bytes.error());
  const auto value = readPropertyList(*bytes);
  auto record = value ? recordFromValue(*value) : std::nullopt;
  if (!record) {
    platformLog(LogLevel::error, "Tasks::record", "{} is malformed: {}", path,
                value ? "keys of the wrong type" : value.error().reason);
    return failWith(EINVAL);
  }
  return *std::move(record);
}

Result<void> Tasks::write(pid_t pid, uint64_t startTime, const TaskRecord& record) const {
  const auto bytes = writeBinaryPropertyList(valueFromRecord(record));
  if (!bytes) return failWith(EINVAL);
  if (const auto made = files_.makePath(tasksDirectory(files_), kDirectoryMode); !made) {
    return made;
  }
  return files_.writeFile(recordPath(files_, pid, startTime), *bytes,
                          {.mode = kRecordMode, .atomic = true});
}

Result<std::vector<TaskProcess>> Tasks::processes() const {
  const auto entries = files_.list(tasksDirectory(files_));
  if (!entries && entries.error().value != ENOENT) return std::unexpected(entries.error());
  std::vector<TaskProcess> processes;
  if (!entries) return processes;
  for (const DirectoryEntry& entry : *entries) {
    if (const auto process = processFromRecordName(entry.name)) processes.push_back(*process);
  }
  return processes;
}

void Tasks::removeStale() const {
  const auto known = processes();
  if (!known) return;
  for (const TaskProcess& process : *known) {
    if (process.isAlive()) continue;
    const std::string path = recordPath(files_, process.pid, process.startTime);
    if (const auto removed = files_.remove(path, nullptr); !removed) {
      platformLog(LogLevel::error, "Tasks::removeStale", "{} stays: {}", path,
                  removed.error().message());
    }
  }
}

// When in doubt it lives: what is unreadable for a moment must not cost a process its identity.
bool TaskProcess::isAlive() const {
  const auto actual = processStartTime(pid);
  return actual ? *actual == startTime : actual.error().value != ESRCH;
}

}  // namespace platform
