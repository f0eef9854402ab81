// Visiting a tree, and measuring one.
//
// A directory is opened before it is shown to the visitor, so that what the visitor is told and
// what the walk then enters are the same directory. What vanishes meanwhile is passed over, and so
// is whatever is mounted inside: it is no part of the tree.
#include <fcntl.h>
#include <sys/sysmacros.h>

#include <set>
#include <utility>

#include "Platform/fs/DirectoryStack.h"
#include "Platform/fs/FileSystem.h"
#include "Platform/fs/OpenBeneath.h"

namespace platform {
namespace {

struct stat statusFrom(const struct statx& from) {
  const auto time = [](const statx_timestamp& stamp) {
    return timespec{stamp.tv_sec, static_cast<long>(stamp.tv_nsec)};
  };
  struct stat status{};
  status.st_dev = makedev(from.stx_dev_major, from.stx_dev_minor);
  status.st_ino = from.stx_ino;
  status.st_mode = from.stx_mode;
  status.st_nlink = from.stx_nlink;
  status.st_uid = from.stx_uid;
  status.st_gid = from.stx_gid;
  status.st_rdev = makedev(from.stx_rdev_major, from.stx_rdev_minor);
  status.st_size = static_cast<off_t>(from.stx_size);
  status.st_blksize = static_cast<blksize_t>(from.stx_blksize);
  status.st_blocks = static_cast<blkcnt_t>(from.stx_blocks);
  status.st_atim = time(from.stx_atime);
  status.st_mtim = time(from.stx_mtime);
  status.st_ctim = time(from.stx_ctime);
  return status;
}

// lstat(2) of an entry; EXDEV when something is mounted on it. Whoever serves that mount is not
// asked for anything.
Result<struct stat> statusOfEntry(int parent, const char* name) {
  struct statx status{};
  constexpr int kFlags = AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | AT_STATX_DONT_SYNC;
  if (::statx(parent, name, kFlags, STATX_BASIC_STATS, &status) != 0) return lastErrno();
  if ((status.stx_attributes & STATX_ATTR_MOUNT_ROOT) != 0) return failWith(EXDEV);
  return statusFrom(status);
}

class Walk {
 public:
  Walk(std::string path, const FileSystem::Visitor& visitor)
      : path_(std::move(path)), visitor_(visitor) {}

  Result<void> run(int parent, const std::string& name) {
    rootParent_ = parent;
    rootName_ = name;
    auto goesOn = visitRoot();
    while (goesOn && *goesOn && !stack_.isEmpty()) goesOn = step();
    if (!goesOn) return std::unexpected(goesOn.error());
    return {};
  }

 private:
  struct Level {
    size_t pathLength;  // of path_ without this directory's name and the slash before it
    struct stat status;
  };

  Result<bool> visitRoot() {
    name_ = rootName_;
    const auto entered = enter(rootParent_, rootName_.c_str(), Mounts::cross);
    if (entered || !isNoDirectory(entered.error())) return entered;
    const auto status = statusOfEntry(rootParent_, rootName_.c_str());
    if (!status) return std::unexpected(status.error());
    return visit(rootParent_, *status, FileSystem::Visit::item);
  }

  Result<bool> step() {
    const auto entry = stack_.next();
    if (!entry) return std::unexpected(entry.error());
    if (!*entry) return leave();
    name_ = (*entry)->name;
    const size_t length = path_.size();
    const size_t depth = stack_.depth();
    path_.append(1, '/').append(name_);
    const auto goesOn = visitEntry((*entry)->type);
    if (stack_.depth() == depth) path_.resize(length);
    if (goesOn) return goesOn;
    const int error = goesOn.error().value;
    if (error == ENOENT || error == EXDEV) return true;
    return goesOn;
  }

  // Shows the entry named name_ of the innermost directory, and goes down into it.
  Result<bool> visitEntry(unsigned char type) {
    const int parent = stack_.innermost();
    bool mayBeDirectory = type == DT_DIR || type == DT_UNKNOWN;
    for (int swap = 0; swap < kSwaps; ++swap) {
      if (mayBeDirectory) {
        const auto entered = enter(parent, name_.c_str(), Mounts::refuse);
        if (entered || !isNoDirectory(entered.error())) return entered;
      }
      const auto status = statusOfEntry(parent, name_.c_str());
      if (!status) return std::unexpected(status.error());
      if (!S_ISDIR(status->st_mode)) return visit(parent, *status, FileSystem::Visit::item);
      mayBeDirectory = true;
    }
    return failWith(EBUSY);
  }

  Result<bool> enter(int parent, const char* name, Mounts mounts) {
    auto directory = openBeneath(parent, name, kReadDirectory, mounts);
    if (!directory) return std::unexpected(directory.error());
    Level level{path_.size() - (stack_.isEmpty() ? 0 : name_.size() + 1), {}};
    if (::fstat(directory->get(), &level.status) != 0) return lastErrno();
    const auto goesOn = visit(parent, level.status, FileSystem::Visit::directoryBefore);
    if (!goesOn || !*goesOn) return goesOn;
    levels_.push_back(level);
    const auto pushed = stack_.push(std::move(*directory));
    if (!pushed) return std::unexpected(pushed.error());
    return true;
  }

  Result<bool> leave() {
    const auto popped = stack_.pop();
    if (!popped) return std::unexpected(popped.error());
    const Level left = levels_.back();
    levels_.pop_back();
    const bool isRoot = stack_.isEmpty();
    name_ = isRoot ? rootName_ : path_.substr(left.pathLength + 1);
    const int parent = isRoot ? rootParent_ : stack_.innermost();
    const auto goesOn = visit(parent, left.status, FileSystem::Visit::directoryAfter);
    path_.resize(left.pathLength);
    return goesOn;
  }

  Result<bool> visit(int parent, const struct stat& status, FileSystem::Visit visit) {
    return visitor_({parent, name_, path_, status, visit, stack_.isEmpty()});
  }

  std::string path_;  // of the item that is being visited
  std::string name_;
  const FileSystem::Visitor& visitor_;
  int rootParent_ = -1;
  std::string rootName_;
  DirectoryStack stack_;
  std::vector<Level> levels_;
};

}  // namespace

Result<void> FileSystem::walk(const std::string& path, const Visitor& visitor) const {
  const auto place = locate(path);
  if (!place) return std::unexpected(place.error());
  return Walk(path, visitor).run(place->parent.get(), place->name);
}

Result<FileSystem::TreeSize> FileSystem::measure(const std::string& path) const {
  constexpr uint64_t kBlockSize = 512;  // the unit of st_blocks
  TreeSize size;
  std::set<std::pair<dev_t, ino_t>> counted;  // files with several names
  const auto walked = walk(path, [&](const WalkEntry& entry) {
    if (entry.visit == Visit::directoryAfter) return true;
    if (!entry.isRoot) ++size.descendants;
    const bool hasOtherNames = entry.visit == Visit::item && entry.status.st_nlink > 1;
    if (!hasOtherNames || counted.emplace(entry.status.st_dev, entry.status.st_ino).second) {
      size.bytes += static_cast<uint64_t>(entry.status.st_blocks) * kBlockSize;
    }
    return true;
  });
  if (!walked) return std::unexpected(walked.error());
  return size;
}

}  // namespace platform
