// Reaching items, and directories.
//
// A path is turned into one relative to the root's descriptor and handed to the kernel whole: one
// openat2 that follows no link walks it as safely as an openat for each component, and faster.
#include "Platform/fs/FileSystem.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <string_view>

#include "Platform/fs/AccessControl.h"
#include "Platform/fs/OpenBeneath.h"
#include "Platform/fs/PrivilegeRules.h"
#include "Platform/fs/RandomName.h"

namespace platform {
namespace {

// A descriptor to work from with the ...at() calls: needs no right to read the directory.
constexpr int kReachDirectory = O_PATH | O_DIRECTORY;
constexpr int kReachItem = O_PATH | O_NOFOLLOW;
constexpr mode_t kPermissionBits = 07777;

struct CloseStream {
  void operator()(DIR* stream) const { ::closedir(stream); }
};

bool hasDotComponent(std::string_view path) {
  for (size_t start = 0; start <= path.size();) {
    const size_t end = std::min(path.find('/', start), path.size());
    const std::string_view component = path.substr(start, end - start);
    if (component == "." || component == "..") return true;
    start = end + 1;
  }
  return false;
}

ItemKind kindOfMode(mode_t mode) {
  if (S_ISDIR(mode)) return ItemKind::directory;
  if (S_ISREG(mode)) return ItemKind::regular;
  return S_ISLNK(mode) ? ItemKind::symbolicLink : ItemKind::other;
}

// None when the entry vanished before it could be looked at.
std::optional<ItemKind> kindOfEntry(int directory, const dirent& entry) {
  switch (entry.d_type) {
    case DT_DIR:
      return ItemKind::directory;
    case DT_REG:
      return ItemKind::regular;
    case DT_LNK:
      return ItemKind::symbolicLink;
    case DT_UNKNOWN: {
      struct stat status{};
      if (::fstatat(directory, entry.d_name, &status, AT_SYMLINK_NOFOLLOW) != 0) return {};
      return kindOfMode(status.st_mode);
    }
    default:
      return ItemKind::other;
  }
}

// Gives a directory just made its mode, whatever the umask, the parent's set-group-id bit and its
// default ACL have made of it.
Result<void> finishDirectory(int parent, const std::string& name, mode_t mode) {
  const auto directory = openBeneath(parent, name.c_str(), kReadDirectory);
  if (!directory) return std::unexpected(directory.error());
  struct stat status{};
  if (::fstat(directory->get(), &status) != 0) return lastErrno();
  if ((status.st_mode & kPermissionBits) != mode && ::fchmod(directory->get(), mode) != 0) {
    return lastErrno();
  }
  return restoreInheritedACL(directory->get());
}

Result<void> makeDirectoryAt(int parent, const std::string& name, mode_t mode,
                             Privilege privilege) {
  const mode_t applied = appliedMode(mode, privilege);
  if (::mkdirat(parent, name.c_str(), applied) != 0) return lastErrno();
  return finishDirectory(parent, name, applied);
}

}  // namespace

FileSystem::FileSystem(std::string root, FileDescriptor descriptor, Privilege privilege)
    : root_(std::move(root)), rootDescriptor_(std::move(descriptor)), privilege_(privilege) {}

Result<std::unique_ptr<FileSystem>> FileSystem::open(const std::string& root, Privilege privilege) {
  const std::unique_ptr<char, decltype(&std::free)> resolved(::realpath(root.c_str(), nullptr),
                                                             &std::free);
  if (!resolved) return lastErrno();
  std::string path = resolved.get();
  FileDescriptor descriptor(::open(path.c_str(), kReachDirectory | O_NOFOLLOW | O_CLOEXEC));
  if (!descriptor.valid()) return lastErrno();
  if (path == "/") path.clear();
  return std::unique_ptr<FileSystem>(
      new FileSystem(std::move(path), std::move(descriptor), privilege));
}

// --- Reaching items -----------------------------------------------------------------------------

Result<const char*> FileSystem::relativeWithDots(const std::string& path) const {
  if (!path.starts_with(root_) || path.find('\0') != std::string::npos) return failWith(EINVAL);
  size_t start = root_.size();
  if (start == path.size() && start > 0) return ".";
  if (start == path.size() || path[start] != '/') return failWith(EINVAL);
  while (start < path.size() && path[start] == '/') ++start;
  return start == path.size() ? "." : path.c_str() + start;
}

Result<const char*> FileSystem::relative(const std::string& path) const {
  const auto whole = relativeWithDots(path);
  if (whole && hasDotComponent(std::string_view(path).substr(root_.size()))) {
    return failWith(EINVAL);
  }
  return whole;
}

Result<FileDescriptor> FileSystem::openAt(const std::string& path, int flags) const {
  const auto relativePath = relative(path);
  if (!relativePath) return std::unexpected(relativePath.error());
  return openBeneath(rootDescriptor_.get(), *relativePath, flags);
}

Result<Place> FileSystem::locate(const std::string& path) const {
  const auto relativePath = relative(path);
  if (!relativePath) return std::unexpected(relativePath.error());
  std::string_view rest = *relativePath;
  while (rest.ends_with('/')) rest.remove_suffix(1);
  if (rest == ".") return failWith(EINVAL);
  const size_t slash = rest.rfind('/');
  const std::string parent(slash == std::string_view::npos ? "." : rest.substr(0, slash));
  auto descriptor = openBeneath(rootDescriptor_.get(), parent.c_str(), kReachDirectory);
  if (!descriptor) return std::unexpected(descriptor.error());
  return Place{std::move(*descriptor), std::string(rest.substr(slash + 1))};
}

Result<FileDescriptor> FileSystem::openDirectory(const std::string& path) const {
  return openAt(path, kReadDirectory);
}

Result<FileDescriptor> FileSystem::openItem(const std::string& path) const {
  return openAt(path, O_RDONLY | O_NONBLOCK | O_NOCTTY);
}

Result<void> FileSystem::exists(const std::string& path) const {
  const auto item = openAt(path, kReachItem);
  if (!item) return std::unexpected(item.error());
  return {};
}

Result<struct stat> FileSystem::status(const std::string& path) const {
  const auto item = openAt(path, kReachItem);
  if (!item) return std::unexpected(item.error());
  struct stat status{};
  if (::fstat(item->get(), &status) != 0) return lastErrno();
  return status;
}

Result<std::vector<DirectoryEntry>> FileSystem::list(const std::string& directory) const {
  auto descriptor = openDirectory(directory);
  if (!descriptor) return std::unexpected(descriptor.error());
  const std::unique_ptr<DIR, CloseStream> stream(::fdopendir(descriptor->get()));
  if (!stream) return lastErrno();
  const int number = descriptor->release();
  std::vector<DirectoryEntry> entries;
  for (;;) {
    errno = 0;
    const dirent* const entry = ::readdir(stream.get());
    if (entry == nullptr) break;
    const std::string_view name = entry->d_name;
    if (name == "." || name == "..") continue;
    const auto kind = kindOfEntry(number, *entry);
    if (kind) entries.push_back({std::string(name), *kind});
  }
  if (errno != 0) return lastErrno();
  return entries;
}

Result<void> FileSystem::syncDirectory(const std::string& path) const {
  const auto directory = openDirectory(path);
  if (!directory) return std::unexpected(directory.error());
  if (::fsync(directory->get()) != 0) return lastErrno();
  return {};
}

// --- Directories --------------------------------------------------------------------------------

Result<void> FileSystem::makeDirectory(const std::string& path, mode_t mode) const {
  const auto place = locate(path);
  if (!place) return std::unexpected(place.error());
  return makeDirectoryAt(place->parent.get(), place->name, mode, privilege_);
}

Result<void> FileSystem::makePath(const std::string& path, mode_t mode) const {
  const auto relativePath = relative(path);
  if (!relativePath) return std::unexpected(relativePath.error());
  auto directory = openBeneath(rootDescriptor_.get(), *relativePath, kReachDirectory);
  if (directory) return {};
  if (directory.error().value != ENOENT) return std::unexpected(directory.error());

  std::string_view rest = *relativePath;
  FileDescriptor parent;  // the root's own until the first component is open
  while (!rest.empty()) {
    const size_t end = std::min(rest.find('/'), rest.size());
    const std::string component(rest.substr(0, end));
    rest.remove_prefix(std::min(end + 1, rest.size()));
    if (component.empty()) continue;
    const int from = parent.valid() ? parent.get() : rootDescriptor_.get();
    directory = openBeneath(from, component.c_str(), kReachDirectory);
    if (!directory && directory.error().value == ENOENT) {
      const auto made = makeDirectoryAt(from, component, mode, privilege_);
      if (!made && made.error().value != EEXIST) return made;
      directory = openBeneath(from, component.c_str(), kReachDirectory);
    }
    if (!directory) return std::unexpected(directory.error());
    parent = std::move(*directory);
  }
  return {};
}

Result<std::string> FileSystem::makeTemporaryDirectory(const std::string& parent,
                                                       const std::string& prefix) const {
  constexpr size_t kRandomCharacters = 6;
  if (prefix.find('/') != std::string::npos) return failWith(EINVAL);
  for (int attempt = 1;; ++attempt) {
    const auto name = randomName(prefix, kRandomCharacters);
    if (!name) return std::unexpected(name.error());
    std::string path = parent;
    if (!path.ends_with('/')) path += '/';
    path += *name;
    const auto made = makeDirectory(path, S_IRWXU);
    if (made) return path;
    if (made.error().value != EEXIST || attempt == kNameAttempts) {
      return std::unexpected(made.error());
    }
  }
}

Result<void> FileSystem::rename(const std::string& from, const std::string& to) const {
  const auto source = locate(from);
  if (!source) return std::unexpected(source.error());
  const auto target = locate(to);
  if (!target) return std::unexpected(target.error());
  if (::renameat(source->parent.get(), source->name.c_str(), target->parent.get(),
                 target->name.c_str()) != 0) {
    return lastErrno();
  }
  return {};
}

}  // namespace platform
