#include "Platform/fs/DirectoryStack.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cstring>
#include <string_view>

namespace platform {
namespace {

constexpr size_t kOpenDirectories = 32;
constexpr size_t kBufferSize = size_t{64} * 1024;

// The start of the kernel's struct linux_dirent64; the name follows.
struct RawEntry {
  uint64_t inode;
  int64_t position;
  uint16_t length;
  uint8_t type;
};
constexpr size_t kNameOffset = 19;

}  // namespace

Result<DirectoryStack::Identity> DirectoryStack::identify(int directory) {
  struct statx status{};
  if (::statx(directory, "", AT_EMPTY_PATH, STATX_INO | STATX_BTIME, &status) != 0) {
    return lastErrno();
  }
  return Identity{makedev(status.stx_dev_major, status.stx_dev_minor), status.stx_ino,
                  status.stx_btime.tv_sec, status.stx_btime.tv_nsec};
}

Result<void> DirectoryStack::close(Level& level) {
  const auto identity = identify(level.directory.get());
  if (!identity) return std::unexpected(identity.error());
  level.identity = *identity;
  level.entries = {};  // read again from `position` on the way back
  level.offset = 0;
  level.directory.reset();
  return {};
}

Result<void> DirectoryStack::push(FileDescriptor directory) {
  Level level;
  level.directory = std::move(directory);
  levels_.push_back(std::move(level));
  if (levels_.size() <= kOpenDirectories) return {};
  Level& outer = levels_[levels_.size() - 1 - kOpenDirectories];
  return outer.directory.valid() ? close(outer) : Result<void>();
}

Result<void> DirectoryStack::pop() {
  if (levels_.size() > 1) {
    Level& outer = levels_[levels_.size() - 2];
    if (!outer.directory.valid()) {
      constexpr int kUp = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
      FileDescriptor directory(::openat(innermost(), "..", kUp));
      if (!directory.valid()) return lastErrno();
      const auto identity = identify(directory.get());
      if (!identity) return std::unexpected(identity.error());
      if (*identity != outer.identity) return failWith(ESTALE);
      if (::lseek(directory.get(), outer.position, SEEK_SET) < 0) return lastErrno();
      outer.directory = std::move(directory);
    }
  }
  levels_.pop_back();
  return {};
}

// Whether there is anything more to read.
Result<bool> DirectoryStack::fill(Level& level) {
  if (buffer_.empty()) buffer_.resize(kBufferSize);
  const long count =
      ::syscall(SYS_getdents64, level.directory.get(), buffer_.data(), buffer_.size());
  if (count < 0) {
    // A directory removed while it is being read has no more entries.
    if (errno != ENOENT) return lastErrno();
    return false;
  }
  level.entries.assign(buffer_.begin(), buffer_.begin() + count);
  level.offset = 0;
  return count > 0;
}

Result<std::optional<DirectoryStack::Entry>> DirectoryStack::next() {
  Level& level = levels_.back();
  for (;;) {
    if (level.offset == level.entries.size()) {
      const auto filled = fill(level);
      if (!filled) return std::unexpected(filled.error());
      if (!*filled) return std::nullopt;
    }
    const char* const bytes = level.entries.data() + level.offset;
    RawEntry raw{};
    std::memcpy(&raw, bytes, kNameOffset);
    level.offset += raw.length;
    level.position = raw.position;
    const char* const name = bytes + kNameOffset;
    const std::string_view text = name;
    if (text != "." && text != "..") return Entry{name, raw.type};
  }
}

}  // namespace platform
