// Owners, modes, protection classes and the immutable flag.
#include <fcntl.h>
#include <fmt/format.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>

#include "Platform/base/WholeNumber.h"
#include "Platform/fs/FileSystem.h"
#include "Platform/fs/OpenBeneath.h"
#include "Platform/fs/PrivilegeRules.h"

namespace platform {
namespace {

constexpr int kClassOfUnmarkedDirectory = 0;
constexpr int kClassOfUnmarkedFile = 3;
// Files of this class have keys that a locked device has thrown away.
constexpr int kClassComplete = 1;

const char* protectionClassAttribute(Privilege privilege) {
  return privilege == Privilege::root ? "trusted.tessary.protection-class"
                                      : "user.tessary.protection-class";
}

// None when the item is unmarked, or marked with what is no number.
Result<std::optional<int>> markedClass(int descriptor, const char* attribute) {
  std::array<char, 16> text{};
  const ssize_t length = ::fgetxattr(descriptor, attribute, text.data(), text.size());
  if (length < 0) {
    // ENOTSUP: a file system without attributes marks nothing.
    if (errno == ENODATA || errno == ENOTSUP || errno == ERANGE) return std::nullopt;
    return lastErrno();
  }
  return wholeNumber<int>({text.data(), static_cast<size_t>(length)});
}

struct ClassOfItem {
  int value;
  bool isRegular;
};

Result<ClassOfItem> classOfItem(int descriptor, const char* attribute) {
  const auto marked = markedClass(descriptor, attribute);
  if (!marked) return std::unexpected(marked.error());
  struct stat status{};
  if (::fstat(descriptor, &status) != 0) return lastErrno();
  const int unmarked = S_ISDIR(status.st_mode) ? kClassOfUnmarkedDirectory : kClassOfUnmarkedFile;
  return ClassOfItem{marked->value_or(unmarked), S_ISREG(status.st_mode)};
}

}  // namespace

Result<void> FileSystem::setOwner(int descriptor, uid_t uid, gid_t gid) const {
  struct stat status{};
  if (::fstat(descriptor, &status) != 0) return lastErrno();
  if (status.st_uid == uid && status.st_gid == gid) return {};
  return ownerChanged(::fchownat(descriptor, "", uid, gid, AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW),
                      privilege_);
}

Result<void> FileSystem::setMode(int descriptor, mode_t mode) const {
  const std::string itself = linkToDescriptor(descriptor);
  if (::chmod(itself.c_str(), appliedMode(mode, privilege_)) != 0) return lastErrno();
  return {};
}

Result<void> FileSystem::setOwnerAt(int parent, const std::string& name, uid_t uid,
                                    gid_t gid) const {
  return ownerChanged(::fchownat(parent, name.c_str(), uid, gid, AT_SYMLINK_NOFOLLOW), privilege_);
}

Result<void> FileSystem::setModeAt(int parent, const std::string& name, mode_t mode) const {
  const mode_t applied = appliedMode(mode, privilege_);
  if (::fchmodat(parent, name.c_str(), applied, AT_SYMLINK_NOFOLLOW) != 0) return lastErrno();
  return {};
}

Result<int> FileSystem::protectionClass(int descriptor) const {
  const auto item = classOfItem(descriptor, protectionClassAttribute(privilege_));
  if (!item) return std::unexpected(item.error());
  return item->value;
}

Result<void> FileSystem::setProtectionClass(int descriptor, int protectionClass) const {
  const char* const attribute = protectionClassAttribute(privilege_);
  const auto item = classOfItem(descriptor, attribute);
  if (!item) return std::unexpected(item.error());
  if (item->value == protectionClass) return {};
  const bool needsKey = item->value == kClassComplete || protectionClass == kClassComplete;
  if (item->isRegular && needsKey && isLocked_ && isLocked_()) return failWith(EPERM);
  const std::string text = fmt::format_int(protectionClass).str();
  if (::fsetxattr(descriptor, attribute, text.data(), text.size(), 0) != 0) return lastErrno();
  return {};
}

Result<bool> FileSystem::clearImmutableAt(int parent, const std::string& name) const {
  // Opening a device or a FIFO has effects of its own, so what is there is looked at first, and
  // then that very item is opened, whatever the name stands for by now.
  constexpr int kLook = O_PATH | O_NOFOLLOW | O_CLOEXEC;
  const FileDescriptor item(::openat(parent, name.c_str(), kLook));
  struct stat status{};
  if (!item.valid() || ::fstat(item.get(), &status) != 0) return lastErrno();
  if (!S_ISREG(status.st_mode) && !S_ISDIR(status.st_mode)) return false;
  const std::string itself = linkToDescriptor(item.get());
  const FileDescriptor open(::open(itself.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
  if (!open.valid()) return lastErrno();

  int flags = 0;
  if (::ioctl(open.get(), FS_IOC_GETFLAGS, &flags) != 0) {
    if (errno == ENOTTY || errno == ENOTSUP) return false;  // a file system without flags
    return lastErrno();
  }
  if ((flags & FS_IMMUTABLE_FL) == 0) return false;
  flags &= ~FS_IMMUTABLE_FL;
  if (::ioctl(open.get(), FS_IOC_SETFLAGS, &flags) != 0) return lastErrno();
  return true;
}

}  // namespace platform
