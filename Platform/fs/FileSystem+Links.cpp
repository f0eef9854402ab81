// The two operations that follow links. The kernel does it, confined to the root's tree.
#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <array>
#include <climits>

#include "Platform/fs/FileSystem.h"
#include "Platform/fs/OpenBeneath.h"

namespace platform {
namespace {

bool isSameItem(int first, int second) {
  struct stat one{};
  struct stat other{};
  if (::fstat(first, &one) != 0 || ::fstat(second, &other) != 0) return false;
  return one.st_dev == other.st_dev && one.st_ino == other.st_ino;
}

}  // namespace

Result<std::string> FileSystem::resolve(const std::string& path) const {
  const auto relativePath = relativeWithDots(path);
  if (!relativePath) return failWith(relativePath.error().value);
  const auto item = lookInside(rootDescriptor_.get(), *relativePath, FinalLink::follow);
  if (!item) return failWith(item.error().value);
  const std::string magicLink = fmt::format("/proc/self/fd/{}", item->get());
  std::array<char, PATH_MAX> text{};
  const ssize_t length = ::readlink(magicLink.c_str(), text.data(), text.size());
  if (length < 0) return lastErrno();
  if (static_cast<size_t>(length) == text.size()) return failWith(ENAMETOOLONG);
  std::string resolved(text.data(), static_cast<size_t>(length));
  // The kernel marks an item that was removed meanwhile in the text itself, and one that was moved
  // may be elsewhere by now: the text counts only when it leads to the item again.
  const auto again = openAt(resolved, O_PATH | O_NOFOLLOW);
  if (!again) return failWith(again.error().value);
  if (!isSameItem(item->get(), again->get())) return failWith(ENOENT);
  return resolved;
}

Result<std::string> FileSystem::readLink(const std::string& path) const {
  const auto relativePath = relativeWithDots(path);
  if (!relativePath) return failWith(relativePath.error().value);
  const auto item = lookInside(rootDescriptor_.get(), *relativePath, FinalLink::open);
  if (!item) return failWith(item.error().value);
  struct stat status{};
  if (::fstat(item->get(), &status) != 0) return lastErrno();
  if (!S_ISLNK(status.st_mode)) return failWith(EINVAL);
  std::array<char, PATH_MAX> text{};
  const ssize_t length = ::readlinkat(item->get(), "", text.data(), text.size());
  if (length < 0) return lastErrno();
  return std::string(text.data(), static_cast<size_t>(length));
}

}  // namespace platform
