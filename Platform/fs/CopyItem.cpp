#include "Platform/fs/CopyItem.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <climits>
#include <string_view>
#include <vector>

#include "Platform/fs/OpenBeneath.h"
#include "Platform/fs/PrivilegeRules.h"

namespace platform {
namespace {

constexpr mode_t kPermissionBits = 07777;

// --- Data ---------------------------------------------------------------------------------------

Result<void> writeAt(int target, const char* bytes, size_t count, off_t offset) {
  while (count > 0) {
    const ssize_t written = ::pwrite(target, bytes, count, offset);
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return lastErrno();
    bytes += written;
    count -= static_cast<size_t>(written);
    offset += written;
  }
  return {};
}

Result<void> copyRangeByHand(int source, int target, off_t offset, off_t end) {
  std::vector<char> buffer(size_t{256} * 1024);
  while (offset < end) {
    const auto wanted = std::min(buffer.size(), static_cast<size_t>(end - offset));
    const ssize_t count = ::pread(source, buffer.data(), wanted, offset);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return lastErrno();
    if (count == 0) return {};  // truncated meanwhile
    const auto written = writeAt(target, buffer.data(), static_cast<size_t>(count), offset);
    if (!written) return written;
    offset += count;
  }
  return {};
}

Result<void> copyRange(int source, int target, off_t offset, off_t end) {
  while (offset < end) {
    off_t to = offset;
    const auto wanted = static_cast<size_t>(end - offset);
    const ssize_t count = ::copy_file_range(source, &offset, target, &to, wanted, 0);
    if (count < 0 && errno == EINTR) continue;
    // What this pair of file systems cannot do fails at once; what went wrong fails by hand too.
    if (count <= 0) return copyRangeByHand(source, target, offset, end);
  }
  return {};
}

// Copies what is there, at most `size` bytes, and leaves the holes out.
Result<void> copyData(int source, int target, off_t size) {
  if (::ioctl(target, FICLONE, source) == 0) return {};
  for (off_t offset = 0; offset < size;) {
    const off_t data = ::lseek(source, offset, SEEK_DATA);
    if (data < 0 && errno == ENXIO) break;  // only a hole is left
    const off_t start = std::max(data, offset);
    const off_t hole = data < 0 ? size : ::lseek(source, start, SEEK_HOLE);
    const off_t end = std::min(hole < 0 ? size : hole, size);
    const auto copied = copyRange(source, target, start, end);
    if (!copied) return copied;
    offset = std::max(end, start);
    if (end <= start) break;
  }
  if (::ftruncate(target, size) != 0) return lastErrno();
  return {};
}

// --- Extended attributes ------------------------------------------------------------------------

// The names of all attributes; none on a file system without.
Result<std::vector<std::string>> attributeNames(int descriptor) {
  std::vector<std::string> names;
  std::array<char, 256> few{};
  std::vector<char> many;
  char* list = few.data();
  ssize_t length = ::flistxattr(descriptor, few.data(), few.size());
  if (length < 0 && errno == ERANGE) {
    many.resize(XATTR_LIST_MAX);
    list = many.data();
    length = ::flistxattr(descriptor, list, many.size());
  }
  if (length < 0 && errno == ENOTSUP) return names;
  if (length < 0) return lastErrno();
  for (const char* name = list; name < list + length; name += names.back().size() + 1) {
    names.emplace_back(name);
  }
  return names;
}

// A label of a security module is the module's business: it gives new items one of its own.
bool mayResist(std::string_view attribute, Privilege privilege) {
  return attribute.starts_with("security.") &&
         (errno == ENOTSUP || (errno == EPERM && privilege == Privilege::none));
}

Result<void> copyAttribute(int source, int target, const std::string& name, Privilege privilege) {
  std::vector<char> value(XATTR_SIZE_MAX);
  const ssize_t length = ::fgetxattr(source, name.c_str(), value.data(), value.size());
  if (length < 0) {
    if (errno == ENODATA) return {};  // removed meanwhile
    return lastErrno();
  }
  const auto size = static_cast<size_t>(length);
  if (::fsetxattr(target, name.c_str(), value.data(), size, 0) != 0) {
    if (mayResist(name, privilege)) return {};
    return lastErrno();
  }
  return {};
}

// What the target has inherited from its parent, a default ACL above all, is not the source's.
Result<void> removeOtherAttributes(int target, const std::vector<std::string>& wanted) {
  const auto present = attributeNames(target);
  if (!present) return std::unexpected(present.error());
  for (const std::string& name : *present) {
    if (std::ranges::find(wanted, name) != wanted.end() || name.starts_with("security.")) continue;
    if (::fremovexattr(target, name.c_str()) != 0 && errno != ENODATA) return lastErrno();
  }
  return {};
}

Result<void> copyExtendedAttributes(int source, int target, Privilege privilege) {
  const auto names = attributeNames(source);
  if (!names) return std::unexpected(names.error());
  const auto removed = removeOtherAttributes(target, *names);
  if (!removed) return removed;
  for (const std::string& name : *names) {
    const auto copied = copyAttribute(source, target, name, privilege);
    if (!copied) return copied;
  }
  return {};
}

// --- Items --------------------------------------------------------------------------------------

Result<void> copyRegular(int file, const struct stat& status, int target,
                         const std::string& newName, Privilege privilege) {
  constexpr int kCreate = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
  const FileDescriptor copy(::openat(target, newName.c_str(), kCreate, S_IRUSR | S_IWUSR));
  if (!copy.valid()) return lastErrno();
  const auto copied = copyData(file, copy.get(), status.st_size);
  if (!copied) return copied;
  return copyAttributes(file, status, copy.get(), privilege);
}

Result<void> copyFIFO(int fifo, const struct stat& status, int target, const std::string& newName,
                      Privilege privilege) {
  if (::mkfifoat(target, newName.c_str(), S_IRUSR | S_IWUSR) != 0) return lastErrno();
  const auto copy = openBeneath(target, newName.c_str(), O_RDONLY | O_NONBLOCK);
  if (!copy) return std::unexpected(copy.error());
  return copyAttributes(fifo, status, copy->get(), privilege);
}

Result<void> copyLink(int link, const struct stat& status, int target, const std::string& newName,
                      Privilege privilege) {
  std::array<char, PATH_MAX> text{};
  const ssize_t length = ::readlinkat(link, "", text.data(), text.size() - 1);
  if (length < 0) return lastErrno();
  const char* const name = newName.c_str();
  if (::symlinkat(text.data(), target, name) != 0) return lastErrno();
  const auto owned = ownerChanged(
      ::fchownat(target, name, status.st_uid, status.st_gid, AT_SYMLINK_NOFOLLOW), privilege);
  if (!owned) return owned;
  const std::array times{status.st_atim, status.st_mtim};
  if (::utimensat(target, name, times.data(), AT_SYMLINK_NOFOLLOW) != 0) return lastErrno();
  return {};
}

}  // namespace

Result<void> copyAttributes(int source, const struct stat& status, int target,
                            Privilege privilege) {
  const auto owned = ownerChanged(::fchown(target, status.st_uid, status.st_gid), privilege);
  if (!owned) return owned;
  if (::fchmod(target, status.st_mode & kPermissionBits) != 0) return lastErrno();
  const auto copied = copyExtendedAttributes(source, target, privilege);
  if (!copied) return copied;
  const std::array times{status.st_atim, status.st_mtim};
  if (::futimens(target, times.data()) != 0) return lastErrno();
  return {};
}

Result<void> copyItem(int source, const std::string& name, int target, const std::string& newName,
                      Privilege privilege) {
  const auto look = openBeneath(source, name.c_str(), O_PATH | O_NOFOLLOW, Mounts::refuse);
  if (!look) return std::unexpected(look.error());
  struct stat status{};
  if (::fstat(look->get(), &status) != 0) return lastErrno();
  if (S_ISLNK(status.st_mode)) return copyLink(look->get(), status, target, newName, privilege);
  if (S_ISDIR(status.st_mode)) return failWith(EISDIR);
  if (!S_ISREG(status.st_mode) && !S_ISFIFO(status.st_mode)) return failWith(ENOTSUP);

  const auto item =
      openBeneath(source, name.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY, Mounts::refuse);
  if (!item) return std::unexpected(item.error());
  if (::fstat(item->get(), &status) != 0) return lastErrno();
  if (S_ISREG(status.st_mode)) {
    return copyRegular(item->get(), status, target, newName, privilege);
  }
  if (S_ISFIFO(status.st_mode)) return copyFIFO(item->get(), status, target, newName, privilege);
  return failWith(EBUSY);  // swapped between the two looks
}

}  // namespace platform
