// Copying a tree.
//
// The copy grows under a temporary name beside its place, in directories that only the daemon can
// enter until they are complete, and is on disk before it is renamed: a power cut leaves the whole
// copy or a dot-named rest. For a tree that takes one syncfs(2) rather than an fsync(2) for every
// file, each of which would wait for a journal commit of its own; a lone file is fsynced.
#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include "Platform/fs/CopyItem.h"
#include "Platform/fs/DirectoryStack.h"
#include "Platform/fs/FileSystem.h"
#include "Platform/fs/OpenBeneath.h"
#include "Platform/fs/RandomName.h"

namespace platform {
namespace {

class TreeCopy {
 public:
  explicit TreeCopy(Privilege privilege) : privilege_(privilege) {}

  // Copies the item `name` of `source`, whatever it is, to `newName` in `target`.
  Result<void> run(int source, const std::string& name, int target, const std::string& newName) {
    auto result = copyEntry(source, name, target, newName, DT_UNKNOWN, Mounts::cross);
    while (result && !sources_.isEmpty()) result = step();
    return result;
  }

 private:
  Result<void> step() {
    const auto entry = sources_.next();
    if (!entry) return std::unexpected(entry.error());
    if (!*entry) return leave();
    const std::string name = (*entry)->name;
    const auto copied = copyEntry(sources_.innermost(), name, targets_.innermost(), name,
                                  (*entry)->type, Mounts::refuse);
    if (copied) return {};
    const int error = copied.error().value;
    // Vanished meanwhile; or what cannot be copied, a socket or a device.
    if (error == ENOENT || error == ENOTSUP) return {};
    return copied;
  }

  Result<void> copyEntry(int source, const std::string& name, int target,
                         const std::string& newName, unsigned char type, Mounts mounts) {
    bool mayBeDirectory = type == DT_DIR || type == DT_UNKNOWN;
    for (int swap = 0; swap < kSwaps; ++swap) {
      if (mayBeDirectory) {
        auto directory = openBeneath(source, name.c_str(), kReadDirectory, mounts);
        if (directory) return enter(std::move(*directory), target, newName);
        if (!isNoDirectory(directory.error())) return std::unexpected(directory.error());
      }
      const auto copied = copyItem(source, name, target, newName, privilege_);
      if (copied || copied.error().value != EISDIR) return copied;
      mayBeDirectory = true;
    }
    return failWith(EBUSY);
  }

  Result<void> enter(FileDescriptor directory, int target, const std::string& newName) {
    struct stat status{};
    if (::fstat(directory.get(), &status) != 0) return lastErrno();
    if (::mkdirat(target, newName.c_str(), S_IRWXU) != 0) return lastErrno();
    auto copy = openBeneath(target, newName.c_str(), kReadDirectory, Mounts::refuse);
    if (!copy) return std::unexpected(copy.error());
    statuses_.push_back(status);
    const auto pushed = targets_.push(std::move(*copy));
    if (!pushed) return pushed;
    return sources_.push(std::move(directory));
  }

  // A directory gets its attributes when its content is complete: the times would not last.
  Result<void> leave() {
    const auto copied =
        copyAttributes(sources_.innermost(), statuses_.back(), targets_.innermost(), privilege_);
    if (!copied) return copied;
    statuses_.pop_back();
    const auto popped = targets_.pop();
    if (!popped) return popped;
    return sources_.pop();
  }

  const Privilege privilege_;
  DirectoryStack sources_;
  DirectoryStack targets_;
  std::vector<struct stat> statuses_;
};

// Brings the finished copy to disk.
Result<void> sync(int parent, const std::string& name) {
  const auto item = openBeneath(parent, name.c_str(), O_PATH | O_NOFOLLOW, Mounts::refuse);
  if (!item) return std::unexpected(item.error());
  struct stat status{};
  if (::fstat(item->get(), &status) != 0) return lastErrno();
  if (!S_ISREG(status.st_mode) && !S_ISDIR(status.st_mode)) return {};
  const auto open = openBeneath(parent, name.c_str(), O_RDONLY | O_NONBLOCK, Mounts::refuse);
  if (!open) return std::unexpected(open.error());
  const int synced = S_ISDIR(status.st_mode) ? ::syncfs(open->get()) : ::fsync(open->get());
  if (synced != 0) return lastErrno();
  return {};
}

Result<void> copyIntoPlace(const Place& source, const Place& target, const std::string& temporary,
                           Privilege privilege) {
  const int parent = target.parent.get();
  auto result = TreeCopy(privilege).run(source.parent.get(), source.name, parent, temporary);
  if (result) result = sync(parent, temporary);
  if (result && ::renameat(parent, temporary.c_str(), parent, target.name.c_str()) != 0) {
    result = lastErrno();
  }
  return result;
}

}  // namespace

Result<void> FileSystem::copy(const std::string& from, const std::string& to) const {
  if (to.starts_with(from + '/')) return failWith(EINVAL);  // a tree into itself
  const auto source = locate(from);
  if (!source) return std::unexpected(source.error());
  const auto target = locate(to);
  if (!target) return std::unexpected(target.error());
  const auto temporary = temporarySiblingName();
  if (!temporary) return std::unexpected(temporary.error());
  auto result = copyIntoPlace(*source, *target, *temporary, privilege_);
  if (!result) {
    const std::string rest = to.substr(0, to.rfind('/') + 1) + *temporary;
    (void)remove(rest, nullptr);  // the copy's own error is the one that counts
  }
  return result;
}

}  // namespace platform
