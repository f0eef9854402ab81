// Getting hold of one item where somebody else may change names at any moment: what was looked at
// is then what is changed.
#include <fcntl.h>
#include <time.h>

#include "Platform/fs/DirectoryStack.h"
#include "Platform/fs/FileSystem.h"
#include "Platform/fs/OpenBeneath.h"
#include "Platform/fs/RandomName.h"

namespace platform {
namespace {

// The time that a change of an inode, made from now on, is marked with at least.
timespec markOfNow() {
  timespec now{};
  ::clock_gettime(CLOCK_REALTIME_COARSE, &now);
  return now;
}

bool isEqual(const timespec& one, const timespec& other) {
  return one.tv_sec == other.tv_sec && one.tv_nsec == other.tv_nsec;
}

// Whether a change made from `now` on would get another change time than `changed`. It would not
// while both fall into one tick of the clock, or into one second where the file system keeps no
// parts of one. A time far ahead is one from before the clock was set back.
bool wouldChangeShow(const timespec& changed, const timespec& now) {
  if (changed.tv_sec > now.tv_sec + 1) return true;
  if (changed.tv_nsec == 0) return changed.tv_sec < now.tv_sec;
  return changed.tv_sec < now.tv_sec ||
         (changed.tv_sec == now.tv_sec && changed.tv_nsec < now.tv_nsec);
}

Result<bool> isEmptyDirectory(int directory) {
  auto again = openBeneath(directory, ".", kReadDirectory);
  if (!again) return std::unexpected(again.error());
  DirectoryStack content;
  const auto pushed = content.push(std::move(*again));
  if (!pushed) return std::unexpected(pushed.error());
  const auto entry = content.next();
  if (!entry) return std::unexpected(entry.error());
  return !*entry;
}

// Opens a directory just made. Whoever may write into `parent` may have put another one there by
// now. One that is the daemon's own and empty is as good: who can move it there could also have
// removed it.
Result<FileDescriptor> openJustMade(int parent, const std::string& name) {
  auto directory = openBeneath(parent, name.c_str(), kReadDirectory, Mounts::refuse);
  if (!directory) return directory;
  struct stat status{};
  if (::fstat(directory->get(), &status) != 0) return lastErrno();
  if (status.st_uid != ::geteuid()) return failWith(ESTALE);
  const auto isEmpty = isEmptyDirectory(directory->get());
  if (!isEmpty) return std::unexpected(isEmpty.error());
  if (!*isEmpty) return failWith(ESTALE);
  return directory;
}

}  // namespace

Result<FileSystem::NewDirectory> FileSystem::makeOpenTemporaryDirectory(
    const std::string& parent, const std::string& prefix) const {
  constexpr size_t kRandomCharacters = 6;
  if (prefix.find('/') != std::string::npos) return failWith(EINVAL);
  const auto holder = openAt(parent, O_PATH | O_DIRECTORY);
  if (!holder) return std::unexpected(holder.error());
  for (int attempt = 1;; ++attempt) {
    const auto name = randomName(prefix, kRandomCharacters);
    if (!name) return std::unexpected(name.error());
    if (::mkdirat(holder->get(), name->c_str(), S_IRWXU) == 0) {
      auto directory = openJustMade(holder->get(), *name);
      if (!directory) return std::unexpected(directory.error());
      return NewDirectory{.name = *name, .directory = std::move(*directory)};
    }
    if (errno != EEXIST || attempt == kNameAttempts) return lastErrno();
  }
}

// Somebody may give a file that lies elsewhere a name here for a moment: its names may be counted
// just when this one has gone again. But making or removing a name marks the file with the time. As
// long as there is no new mark the number of names is the same, and one name that was found here
// meanwhile is the only one.
Result<FileDescriptor> FileSystem::holdOnlyName(int parent, const std::string& name) const {
  auto item = openBeneath(parent, name.c_str(), O_PATH | O_NOFOLLOW, Mounts::refuse);
  if (!item) return item;
  const timespec now = markOfNow();
  struct stat before{};
  struct stat named{};
  struct stat after{};
  if (::fstat(item->get(), &before) != 0) return lastErrno();
  if (S_ISDIR(before.st_mode)) return item;
  if (before.st_nlink != 1) return failWith(EMLINK);
  if (!wouldChangeShow(before.st_ctim, now)) return failWith(EAGAIN);
  if (::fstatat(parent, name.c_str(), &named, AT_SYMLINK_NOFOLLOW) != 0 ||
      ::fstat(item->get(), &after) != 0) {
    return lastErrno();
  }
  const bool isThere = named.st_dev == before.st_dev && named.st_ino == before.st_ino;
  if (!isThere || !isEqual(before.st_ctim, after.st_ctim)) return failWith(EAGAIN);
  return item;
}

}  // namespace platform
