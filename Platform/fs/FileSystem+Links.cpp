// The two operations that follow links. The kernel does it, confined to the root's tree.
#include <fcntl.h>
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
  if (!relativePath) return std::unexpected(relativePath.error());
  const auto item = lookInside(rootDescriptor_.get(), *relativePath, FinalLink::follow);
  if (!item) return std::unexpected(item.error());
  const std::string link = linkToDescriptor(item->get());
  std::array<char, PATH_MAX> text{};
  const ssize_t length = ::readlink(link.c_str(), text.data(), text.size());
  if (length < 0) return lastErrno();
  if (static_cast<size_t>(length) == text.size()) return failWith(ENAMETOOLONG);
  std::string resolved(text.data(), static_cast<size_t>(length));
  // The kernel marks an item that was removed meanwhile in the text itself, and one that was moved
  // may be elsewhere by now: the text counts only when it leads to the item again.
  const auto again = openAt(resolved, O_PATH | O_NOFOLLOW);
  if (!again) return std::unexpected(again.error());
  if (!isSameItem(item->get(), again->get())) return failWith(ENOENT);
  return resolved;
}

Result<std::string> FileSystem::readLink(const std::string& path) const {
  const auto relativePath = relativeWithDots(path);
  if (!relativePath) return std::unexpected(relativePath.error());
  const auto item = lookInside(rootDescriptor_.get(), *relativePath, FinalLink::open);
  if (!item) return std::unexpected(item.error());
  struct stat status{};
  if (::fstat(item->get(), &status) != 0) return lastErrno();
  if (!S_ISLNK(status.st_mode)) return failWith(EINVAL);
  std::array<char, PATH_MAX> text{};
  const ssize_t length = ::readlinkat(item->get(), "", text.data(), text.size());
  if (length < 0) return lastErrno();
  return std::string(text.data(), static_cast<size_t>(length));
}

}  // namespace platform
