// The one door to files below the root.
//
// Per-user trees belong to users, and the daemon works in them as root: whoever owns a directory
// can put a link, a FIFO or a mount in the way at any moment. So no path below the root is ever
// followed by name alone. Every operation opens the parent directory with openat2(2), beneath the
// descriptor of the root and without following a link, and then works on (descriptor, last name)
// with O_NOFOLLOW and the ...at() calls. Walks, copies and removals descend by descriptor and do
// not enter a mount.
//
// A path is absolute and lies below root(); one that does not, or that holds "." or "..", or a NUL
// byte, fails with EINVAL. A link where a directory must be fails with ELOOP. No operation waits
// for a FIFO's other end.
//
// Without root's rights (Privilege::none) a change of owner that the kernel refuses is passed over,
// mode 0 becomes 0700 and attributes live in "user." instead of "trusted.". With them nothing is
// passed over.
//
// The object holds no state but the root's descriptor: any thread may call any operation.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "Platform/base/Errno.h"
#include "Platform/base/FileDescriptor.h"

namespace platform {

enum class Privilege { none, root };

enum class ItemKind { directory, regular, symbolicLink, other };

struct DirectoryEntry {
  std::string name;
  ItemKind kind;
};

// An item as (open parent directory, name in it). The parent is open with O_PATH: good for the
// ...at() calls and /proc/self/fd, not for reading or fsync.
struct Place {
  FileDescriptor parent;
  std::string name;
};

// How a file is written. `mode` is applied exactly, whatever the umask.
struct WriteOptions {
  mode_t mode = 0644;
  std::optional<int> protectionClass = std::nullopt;
  bool atomic = false;  // write a temporary sibling, then rename it over the target
};

class FileSystem {
 public:
  // Resolves `root` (realpath) and opens it. Fails with the errno of either.
  static Result<std::unique_ptr<FileSystem>> open(const std::string& root, Privilege privilege);

  // The resolved root without a trailing slash: "" when it is "/".
  const std::string& root() const { return root_; }
  Privilege privilege() const { return privilege_; }

  // --- Reaching items -------------------------------------------------------------------------
  Result<Place> locate(const std::string& path) const;
  // Opens an existing directory for reading (O_DIRECTORY, no links anywhere in the path).
  Result<FileDescriptor> openDirectory(const std::string& path) const;
  // Opens any existing item for reading, without following a final link and without waiting.
  Result<FileDescriptor> openItem(const std::string& path) const;
  // Succeeds when something is there, a link that leads nowhere included.
  Result<void> exists(const std::string& path) const;
  // lstat(2).
  Result<struct stat> status(const std::string& path) const;
  // Every entry but "." and "..", in the order of the directory. ENOTDIR, ENOENT and so on.
  Result<std::vector<DirectoryEntry>> list(const std::string& directory) const;

  // --- Following links ------------------------------------------------------------------------
  // The two operations that do, for checks on paths of other people's making. Here a path may hold
  // "." and "..". The tree below the root is a world of its own: an absolute link starts at the
  // root, and nothing leads out.
  //
  // realpath(3): the absolute path, root included, without any link.
  Result<std::string> resolve(const std::string& path) const;
  // readlink(2): the text of a final link, after following those before it. EINVAL for no link.
  Result<std::string> readLink(const std::string& path) const;

  // --- Small files ------------------------------------------------------------------------------
  // The whole content of a regular file; EINVAL when it is none, EFBIG over `limit` bytes.
  Result<std::vector<uint8_t>> readFile(const std::string& path, size_t limit) const;
  // Creates or replaces a regular file, synced to disk before it can be seen under its name when
  // atomic, and before the call returns when not. What stands at the name is never written through.
  Result<void> writeFile(const std::string& path, std::span<const uint8_t> bytes,
                         const WriteOptions& options) const;
  // Removes the files that atomic writes which were cut short have left in a directory, into which
  // nobody may be writing. A missing directory is success.
  Result<void> removeTemporaryFiles(const std::string& directory) const;
  // fsync(2) of a directory: what was renamed into it stays after a power cut.
  Result<void> syncDirectory(const std::string& path) const;

  // --- Directories ------------------------------------------------------------------------------
  // mkdir(2) with exactly this mode. EEXIST when something stands there.
  Result<void> makeDirectory(const std::string& path, mode_t mode) const;
  // As makeDirectory for every missing component. Success when a directory is there already.
  Result<void> makePath(const std::string& path, mode_t mode) const;
  // A new directory of mode 0700 in `parent`, named `prefix` and six random characters.
  Result<std::string> makeTemporaryDirectory(const std::string& parent,
                                             const std::string& prefix) const;
  // The same in a directory that somebody else may be changing, held open: what is done through the
  // descriptor is done to the new directory, whatever stands at its name by then. ESTALE when
  // something else stood there at once. The mask of an inherited ACL is not widened again.
  struct NewDirectory {
    std::string name;  // in the parent
    FileDescriptor directory;
  };
  Result<NewDirectory> makeOpenTemporaryDirectory(const std::string& parent,
                                                  const std::string& prefix) const;

  // --- Moving, copying, removing ----------------------------------------------------------------
  // rename(2). EXDEV across file systems and mounts.
  Result<void> rename(const std::string& from, const std::string& to) const;
  // Copies the whole tree: data (cloned where the file system can), modes, owners, times, extended
  // attributes, ACLs and links. The copy is made under a dot-named sibling of `to` and renamed, so
  // that a half copy never stands at `to`.
  Result<void> copy(const std::string& from, const std::string& to) const;
  // Removes the whole tree. `onFailure` is told of every item that resists, with the descriptor of
  // its parent, its name there, its path for messages and the error; it answers nothing when it
  // has removed the item itself, else the errno to record. The walk always goes on; the first
  // recorded errno is the result. ENOENT anywhere counts as removed.
  using RemovalFailure = std::function<std::optional<Errno>(int parent, const std::string& name,
                                                            const std::string& path, Errno error)>;
  Result<void> remove(const std::string& path, const RemovalFailure& onFailure) const;

  // --- Attributes, on an open item --------------------------------------------------------------
  // Opens (O_PATH) the item `name` of an open directory, a link itself. Fails with EMLINK for what
  // is no directory and has another name too: it may be anybody's file. EAGAIN: it was changed just
  // now, in the last few milliseconds, or is being changed, and this cannot be told yet.
  Result<FileDescriptor> holdOnlyName(int parent, const std::string& name) const;
  // Changes only what differs. For this and the next, an item open with O_PATH will do.
  Result<void> setOwner(int descriptor, uid_t uid, gid_t gid) const;
  Result<void> setMode(int descriptor, mode_t mode) const;
  // The protection class of the item behind the descriptor. Unmarked: a directory 0, a file 3.
  Result<int> protectionClass(int descriptor) const;
  // EPERM for a regular file from or to class 1 while the device is locked.
  Result<void> setProtectionClass(int descriptor, int protectionClass) const;

  // --- Attributes, on (parent, name) without following a link -----------------------------------
  Result<void> setOwnerAt(int parent, const std::string& name, uid_t uid, gid_t gid) const;
  Result<void> setModeAt(int parent, const std::string& name, mode_t mode) const;
  // Clears the immutable flag (FS_IMMUTABLE_FL). Returns whether it was set.
  Result<bool> clearImmutableAt(int parent, const std::string& name) const;

  // --- Walking ----------------------------------------------------------------------------------
  enum class Visit { item, directoryBefore, directoryAfter };
  struct WalkEntry {
    int parent;               // open directory that holds the item
    const std::string& name;  // its name there
    const std::string& path;  // for messages
    const struct stat& status;
    Visit visit;
    bool isRoot;
  };
  // Visits every entry below `path` and the root itself, directories before and after their
  // contents, without following links or entering mounts. The visitor answers whether to go on;
  // when it says no, the walk ends with success.
  using Visitor = std::function<bool(const WalkEntry& entry)>;
  Result<void> walk(const std::string& path, const Visitor& visitor) const;

  // Allocated bytes of the tree (st_blocks), each hard-linked file once, links not followed.
  struct TreeSize {
    uint64_t bytes = 0;
    uint64_t descendants = 0;
  };
  Result<TreeSize> measure(const std::string& path) const;

  // Tells protection classes whether the device is locked. Set once, before any other thread runs.
  void setLockStateSource(std::function<bool()> isLocked) { isLocked_ = std::move(isLocked); }

 private:
  FileSystem(std::string root, FileDescriptor descriptor, Privilege privilege);

  // The path below the root's descriptor, "." for the root itself. Points into `path`.
  Result<const char*> relative(const std::string& path) const;
  // The same without looking at the components.
  Result<const char*> relativeWithDots(const std::string& path) const;
  Result<FileDescriptor> openAt(const std::string& path, int flags) const;
  Result<void> createFileAt(int parent, const std::string& name, std::span<const uint8_t> bytes,
                            const WriteOptions& options) const;

  std::string root_;
  FileDescriptor rootDescriptor_;
  Privilege privilege_;
  std::function<bool()> isLocked_;
};

}  // namespace platform
