// run/tessary lives until reboot. What marks a reboot is the kernel's boot id: the directory keeps
// the one it was made under in "boot-id", and is emptied when they differ. Emptying happens under
// the directory's lock, so that two processes that start at once do it once, and neither takes away
// what the other has already put there. The lock is a file that only the daemon's user can open: a
// lock on the directory itself could be held by anybody who can list it.
#include "Platform/os/RuntimeDirectory.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sodium.h>
#include <sys/file.h>
#include <unistd.h>

#include <array>

#include "Platform/os/OpenFile.h"

namespace platform {
namespace {

constexpr char kLockName[] = "lock";
constexpr char kBootIDName[] = "boot-id";
constexpr mode_t kDirectoryMode = 0755;

Result<std::string> kernelBootID() {
  constexpr size_t kLongestBootID = 4096;
  const FileDescriptor file(::open("/proc/sys/kernel/random/boot_id", O_RDONLY | O_CLOEXEC));
  if (!file.valid()) return lastErrno();
  const auto bytes = readToEnd(file.get(), kLongestBootID);
  if (!bytes) return std::unexpected(bytes.error());
  return std::string(asText(*bytes));
}

// Whether the directory has been open to other users' files. It no longer is then.
Result<bool> closeToOthers(const FileSystem& files, const std::string& directory) {
  const auto descriptor = files.openDirectory(directory);
  if (!descriptor) return std::unexpected(descriptor.error());
  struct stat status{};
  if (::fstat(descriptor->get(), &status) != 0) return lastErrno();
  if (status.st_uid != ::geteuid()) return failWith(EPERM);
  if ((status.st_mode & (S_IWGRP | S_IWOTH)) == 0) return false;
  if (::fchmod(descriptor->get(), kDirectoryMode) != 0) return lastErrno();
  return true;
}

bool isOfThisBoot(const FileSystem& files, const std::string& directory,
                  const std::string& bootID) {
  const auto stored = files.readFile(directory + "/" + kBootIDName, bootID.size());
  return stored && asText(*stored) == bootID;
}

Result<void> removeContents(const FileSystem& files, const std::string& directory) {
  const auto entries = files.list(directory);
  if (!entries) return std::unexpected(entries.error());
  for (const DirectoryEntry& entry : *entries) {
    if (entry.name == kLockName) continue;
    if (const auto removed = files.remove(directory + "/" + entry.name, nullptr); !removed) {
      return removed;
    }
  }
  return {};
}

bool isPlain(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '.' ||
         c == '_' || c == '-';
}

std::string hashInHexadecimal(std::string_view identifier) {
  std::array<unsigned char, crypto_generichash_BYTES> hash{};
  crypto_generichash(hash.data(), hash.size(),
                     reinterpret_cast<const unsigned char*>(identifier.data()), identifier.size(),
                     nullptr, 0);
  return fmt::format("{:02x}", fmt::join(hash, ""));
}

}  // namespace

std::string configurationDirectory(const FileSystem& files) {
  return files.root() + "/etc/tessary";
}

std::string runtimeDirectory(const FileSystem& files) {
  return files.root() + "/run/tessary";
}

Result<FileDescriptor> lockRuntimeDirectory(const FileSystem& files) {
  const auto place = files.locate(runtimeDirectory(files) + "/" + kLockName);
  if (!place) return std::unexpected(place.error());
  constexpr int kFlags = O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
  FileDescriptor file(::openat(place->parent.get(), place->name.c_str(), kFlags, 0600));
  if (!file.valid()) return lastErrno();
  while (::flock(file.get(), LOCK_EX) != 0) {
    if (errno != EINTR) return lastErrno();
  }
  return file;
}

Result<void> prepareRuntimeDirectory(const FileSystem& files) {
  const std::string directory = runtimeDirectory(files);
  if (const auto made = files.makePath(directory, kDirectoryMode); !made) return made;
  const auto wasOpen = closeToOthers(files, directory);
  if (!wasOpen) return std::unexpected(wasOpen.error());
  const auto bootID = kernelBootID();
  if (!bootID) return std::unexpected(bootID.error());
  const auto lock = lockRuntimeDirectory(files);
  if (!lock) return std::unexpected(lock.error());
  if (!*wasOpen && isOfThisBoot(files, directory, *bootID)) return {};
  if (const auto removed = removeContents(files, directory); !removed) return removed;
  // Last, so that an interrupted emptying is done again.
  return files.writeFile(directory + "/" + kBootIDName, asBytes(*bootID), {.atomic = true});
}

std::string fileNameForIdentifier(std::string_view identifier) {
  constexpr size_t kLongestName = 200;
  if (identifier.empty()) return "%";
  std::string name;
  for (size_t i = 0; i < identifier.size() && name.size() <= kLongestName; ++i) {
    const char c = identifier[i];
    if (isPlain(c) && !(c == '.' && i == 0)) {
      name += c;
    } else {
      fmt::format_to(std::back_inserter(name), "%{:02X}", static_cast<unsigned char>(c));
    }
  }
  return name.size() <= kLongestName ? name : "%%" + hashInHexadecimal(identifier);
}

}  // namespace platform
